// The configuration object model: JSON form, reading, lenient members and
// FromJsonText. Any JSON anywhere never throwing is the json_cfg fuzzer's.
#include <gtest/gtest.h>

#include <type_traits>

#include "pm/cfg/object.h"
#include "pm/cfg/widgets.h"
#include "support/log_capture.h"

namespace {

using pm::cfg::Json;

// Members and children point at their owner; a copy or move would leave them
// pointing at the original.
static_assert(!std::is_copy_constructible_v<pm::cfg::Object>);
static_assert(!std::is_copy_assignable_v<pm::cfg::Object>);
static_assert(!std::is_move_constructible_v<pm::cfg::Popup>);
static_assert(!std::is_copy_constructible_v<pm::cfg::MemberT<bool>>);

struct Leaf : pm::cfg::Object {
  Leaf(Object* parent, std::string key) : Object(parent, "leaf", std::move(key), false) {}
  pm::cfg::MemberT<std::int64_t> n{this, "n", 0};
};

struct Root : pm::cfg::Object {
  explicit Root(bool ordered) : Object(nullptr, "", "root", ordered) {}
  pm::cfg::MemberT<bool> flag{this, "flag", true};
  pm::cfg::MemberT<std::string> text{this, "text", "t"};
  Leaf c{this, "c"};
  Leaf a{this, "a"};
  Leaf b{this, "b"};
};

Json Write(pm::cfg::Object& o, Json out = nullptr) {
  o.ToJson(out);
  return out;
}

// ---------------------------------------------------------------------------
// Writing

TEST(ObjectToJson, OrderedParentNumbersItsDirectChildrenInConstructionOrder) {
  Root root(/*ordered=*/true);
  const Json out = Write(root);
  // Keys come out in byte order; only "pm::order" tells construction order.
  EXPECT_EQ(out["c"]["pm::order"], 0);
  EXPECT_EQ(out["a"]["pm::order"], 1);
  EXPECT_EQ(out["b"]["pm::order"], 2);
  EXPECT_TRUE(out["a"]["pm::order"].is_number_integer());
  EXPECT_FALSE(out.contains("pm::order"));  // a root has no parent to number it
  struct Mid : pm::cfg::Object {
    explicit Mid(Object* parent) : Object(parent, "mid", "m", false) {}
    Leaf x{this, "x"};
  };
  struct OrderedRoot : pm::cfg::Object {
    OrderedRoot() : Object(nullptr, "", "r", true) {}
    Mid m{this};
    pm::cfg::Object empty{this, "", "e", false};
  } nested;
  const Json deep = Write(nested);
  EXPECT_EQ(deep["m"]["pm::order"], 0);
  EXPECT_FALSE(deep["m"]["x"].contains("pm::order"));
  EXPECT_EQ(deep["e"], (Json{{"pm::order", 1}}));  // an empty child still gets its order
}

TEST(ObjectToJson, UnorderedParentWritesNoOrder) {
  Root root(/*ordered=*/false);
  EXPECT_EQ(pmjson::Dump(Write(root)),
            R"({"a":{"n":0,"type":"leaf"},"b":{"n":0,"type":"leaf"},"c":{"n":0,"type":"leaf"},)"
            R"("flag":true,"text":"t"})");
}

TEST(ObjectToJson, TypeOnlyWhenNotEmptyAndEmptyObjectIsNull) {
  pm::cfg::Object empty(nullptr, "", "e", false);
  EXPECT_TRUE(Write(empty, {{"stale", 1}}).is_null());  // whatever the caller passes is replaced
  pm::cfg::Object typed(nullptr, "static_text", "t", false);
  EXPECT_EQ(Write(typed), (Json{{"type", "static_text"}}));
  Root root(false);
  EXPECT_FALSE(Write(root).contains("type"));
}

TEST(ObjectToJson, ChildWritingANonObjectOrAMembersKeyWins) {
  struct ArrayChild : pm::cfg::Object {
    explicit ArrayChild(Object* parent) : Object(parent, "", "arr", false) {}
    void ToJson(Json& out) override { out = Json::array({1}); }
  };
  struct R : pm::cfg::Object {
    R() : Object(nullptr, "", "r", true) {}
    ArrayChild child{this};
    pm::cfg::MemberT<std::string> clash{this, "x", "member"};
    Leaf x{this, "x"};
  } root;
  EXPECT_EQ(Write(root), (Json{{"arr", {1}}, {"x", {{"n", 0}, {"pm::order", 1}, {"type", "leaf"}}}}));
}

// ---------------------------------------------------------------------------
// Reading

TEST(ObjectFromJson, ReadsMembersAndChildrenAndIgnoresUnknownAndMissingKeys) {
  Root root(false);
  root.a.n.value = 3;
  root.FromJson(Json::parse(R"({"flag":false,"b":{"n":5,"zz":1},"x":1,"text":"new","n":9})"));
  EXPECT_FALSE(root.flag.value);
  EXPECT_EQ(root.text.value, "new");
  EXPECT_EQ(root.b.n.value, 5);
  EXPECT_EQ(root.a.n.value, 3);  // missing: unchanged
  EXPECT_EQ(root.c.n.value, 0);  // top-level "n" belongs to no member of the root
}

TEST(ObjectFromJson, NonObjectInputChangesNothing) {
  for (const Json& in : {Json(nullptr), Json(1), Json("flag"), Json::array({false, "x"}),
                         Json::parse(R"([{"flag":false}])"), Json::parse(R"({"a":[{"n":1}],"b":7,"c":null})")}) {
    SCOPED_TRACE(in.dump());
    Root root(false);
    root.a.n.value = 4;
    root.FromJson(in);
    EXPECT_TRUE(root.flag.value);
    EXPECT_EQ(root.text.value, "t");
    EXPECT_EQ(root.a.n.value, 4);
    EXPECT_EQ(root.b.n.value, 0);
  }
}

// ---------------------------------------------------------------------------
// Lenient members

struct Values : pm::cfg::Object {
  Values() : Object(nullptr, "", "v", false) {}
  pm::cfg::MemberT<bool> b{this, "b", false};
  pm::cfg::MemberT<std::int64_t> i{this, "i", 77};
  pm::cfg::MemberT<std::string> s{this, "s", "init"};
  pm::cfg::MemberVectorT<> v{this, "v", {"x", "y"}};
};

// Reads each input into a member first set to `before` and expects `after`.
template <typename Member, typename Value>
void ExpectReads(Member& member, Value before, std::initializer_list<std::pair<Json, Value>> cases) {
  for (const auto& [in, expected] : cases) {
    SCOPED_TRACE(in.dump());
    member.value = before;
    member.FromJson(in);
    EXPECT_EQ(member.value, expected);
  }
}

TEST(Members, ScalarsReadAnyJsonLeniently) {
  Values m;
  ExpectReads<pm::cfg::MemberT<bool>, bool>(
      m.b, true, {{"Yes", true}, {"yes please", false}, {0.5, true}, {"1", true}, {0, false}, {nullptr, false},
                  {Json::object(), false}, {18446744073709551615u, true}});
  ExpectReads<pm::cfg::MemberT<bool>, bool>(m.b, false, {{"Yes", true}});
  ExpectReads<pm::cfg::MemberT<std::int64_t>, std::int64_t>(
      m.i, 77, {{"42abc", 42}, {2.9, 2}, {-2.9, -2}, {true, 1}, {"x", 0}, {nullptr, 0}, {1e300, 0},
                {-9223372036854775807 - 1, INT64_MIN}});
  ExpectReads<pm::cfg::MemberT<std::string>, std::string>(
      m.s, "init", {{true, "1"}, {12, "12"}, {nullptr, ""}, {-3, "-3"}, {2.5, "2.5"}, {Json::object({{"a", 1}}), ""}});
}

TEST(Members, VectorReplacesItsContentsAndTakesScalarsAsOneElement) {
  Values m;
  using V = std::vector<std::string>;
  ExpectReads<pm::cfg::MemberVectorT<>, V>(
      m.v, V{"x"}, {{Json::array({"a", 5}), V{"a", "5"}}, {"a", V{"a"}}, {Json::array(), V{}},
                    {Json::array({Json::array({"nested"}), true}), V{"", "1"}}});  // no flattening
  EXPECT_EQ(m.v.ToJson(), Json::array({"", "1"}));
}

TEST(Members, ScalarGivenAnArrayKeepsTheLastElementAndEmptyArrayClears) {
  Values m;
  m.FromJson(Json::parse(R"({"b":[true,false,"yes"],"i":[1,"2",3.7],"s":["p","q"]})"));
  EXPECT_TRUE(m.b.value);
  EXPECT_EQ(m.i.value, 3);
  EXPECT_EQ(m.s.value, "q");
  m.FromJson(Json::parse(R"({"b":[],"i":[],"s":[]})"));
  EXPECT_FALSE(m.b.value);
  EXPECT_EQ(m.i.value, 0);
  EXPECT_EQ(m.s.value, "");
}

TEST(Members, EnumKeepsValuesTheEnumerationDoesNotName) {
  struct E : pm::cfg::Object {
    E() : Object(nullptr, "", "e", false) {}
    pm::cfg::MemberEnumT<pm::cfg::VisualIndication> ind{this, "ind"};
  } e;
  EXPECT_EQ(e.ind.value, 0);
  e.FromJson(Json::parse(R"({"ind":"101"})"));
  EXPECT_EQ(e.ind.Get(), pm::cfg::VisualIndication::Error);
  e.FromJson(Json::parse(R"({"ind":12345})"));
  EXPECT_EQ(Write(e), (Json{{"ind", 12345}}));
  e.FromJson(Json::parse(R"({"ind":[]})"));
  EXPECT_EQ(e.ind.value, 0);
}

// Text nested deeper than the JSON limit is refused before a value is built
// (reading it would be safe, copying or printing it would not): the members
// keep their values and one line is logged.
TEST(HostileInput, TextNestedTooDeepIsRefusedAndTheValuesKept) {
  constexpr int kDepth = 200000;
  std::string text = R"({"i":)" + std::string(kDepth, '[') + "7" + std::string(kDepth, ']') +
                     R"(,"v":)" + std::string(kDepth, '[') + std::string(kDepth, ']') +
                     R"(,"s":{"s":)" + std::string(kDepth, '[') + std::string(kDepth, ']') + "}}";
  pmtest::LogCapture capture;
  Values m;
  m.FromJsonText(text);
  EXPECT_EQ(m.i.value, 77);
  EXPECT_EQ(m.v.value, (std::vector<std::string>{"x", "y"}));
  EXPECT_EQ(m.s.value, "init");
  EXPECT_EQ(capture.Lines().size(), 1u);
  EXPECT_EQ(capture.Count("nests deeper than 256 levels"), 1);
}

TEST(HostileInput, HugeArraysAreReadInOnePass) {
  Values m;
  Json big = Json::array();
  for (int k = 0; k < 200000; ++k) big.push_back(k);
  m.FromJson(Json{{"i", big}, {"v", big}});
  EXPECT_EQ(m.i.value, 199999);
  ASSERT_EQ(m.v.value.size(), 200000u);
  EXPECT_EQ(m.v.value.back(), "199999");
}

// ---------------------------------------------------------------------------
// FromJsonText: reads what parses, validates in every case, logs a bad text once.

TEST(FromJsonText, ReadsValidatesAndLogsBadText) {
  struct TextGui : pm::cfg::Gui {
    TextGui() : Gui(nullptr, "", "gui", true) {}
    pm::cfg::Popup choice{this, "choice", "t", {"a", "b", "c"}};
    pm::cfg::StaticText line{this, "line", "t"};
  };
  struct Case {
    const char* text;
    std::int64_t choice;  // after Validate
    const char* line;
    std::vector<std::string> log;
  } cases[] = {
      {R"({"line":{"value":"lost")", 0, "kept",
       {"pmjson::Parse failed: UpdateConfiguration '{\"line\":{\"value\":\"lost\"'\n"}},
      {"", 0, "kept", {}},
      {R"({"choice":{"value":"2"},"line":{"value":12}})", 2, "12", {}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.text);
    pmtest::LogCapture capture;
    TextGui gui;
    gui.line.value = "kept";
    gui.choice.value = 7;  // out of range: Validate must still run
    gui.FromJsonText(c.text, "UpdateConfiguration");
    EXPECT_EQ(gui.choice.value.value, c.choice);
    EXPECT_EQ(gui.line.value.value, c.line);
    EXPECT_EQ(capture.Lines(), c.log);
  }
}

TEST(FromJsonText, AThrowingReadIsCaughtLoggedAndFollowedByValidate) {
  struct Throwing : pm::cfg::Object {
    Throwing() : Object(nullptr, "", "t", false) {}
    void FromJson(const Json& in) override { (void)in.at("missing"); }  // strict read
    void Validate() override { ++validated; }
    int validated = 0;
  } t;
  pmtest::LogCapture capture;
  EXPECT_NO_THROW(t.FromJsonText(R"({"a":1})", "label"));
  EXPECT_EQ(t.validated, 1);
  ASSERT_EQ(capture.Lines().size(), 1u);
  EXPECT_EQ(capture.Lines()[0].rfind("pm::cfg::Object::FromJsonText: label: ", 0), 0u);
}

}  // namespace
