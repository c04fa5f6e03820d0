// The configuration object model: JSON form, reading, lenient members,
// FromJsonText and FromGui.
#include <gtest/gtest.h>

#include <stdexcept>
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
  Leaf(Object* parent, std::string key, std::string type = "leaf")
      : Object(parent, std::move(type), std::move(key), false) {}
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

// ---------------------------------------------------------------------------
// Writing

TEST(ObjectToJson, OrderedParentNumbersChildrenInConstructionOrder) {
  Root root(/*ordered=*/true);
  Json out;
  root.ToJson(out);
  // Keys come out in byte order; only "pm::order" tells construction order.
  EXPECT_EQ(out["c"]["pm::order"], 0);
  EXPECT_EQ(out["a"]["pm::order"], 1);
  EXPECT_EQ(out["b"]["pm::order"], 2);
  EXPECT_TRUE(out["a"]["pm::order"].is_number_integer());
  EXPECT_FALSE(out.contains("pm::order"));  // a root has no parent to number it
}

TEST(ObjectToJson, UnorderedParentWritesNoOrder) {
  Root root(/*ordered=*/false);
  Json out;
  root.ToJson(out);
  EXPECT_EQ(pmjson::Dump(out),
            R"({"a":{"n":0,"type":"leaf"},"b":{"n":0,"type":"leaf"},"c":{"n":0,"type":"leaf"},)"
            R"("flag":true,"text":"t"})");
}

TEST(ObjectToJson, OrderIsAddedOnlyByTheDirectParent) {
  struct Mid : pm::cfg::Object {
    explicit Mid(Object* parent) : Object(parent, "mid", "m", false) {}
    Leaf x{this, "x"};
  };
  struct OrderedRoot : pm::cfg::Object {
    OrderedRoot() : Object(nullptr, "", "r", true) {}
    Mid m{this};
  } root;
  Json out;
  root.ToJson(out);
  EXPECT_EQ(out["m"]["pm::order"], 0);
  EXPECT_FALSE(out["m"]["x"].contains("pm::order"));
}

TEST(ObjectToJson, TypeOnlyWhenNotEmptyAndEmptyObjectIsNull) {
  pm::cfg::Object empty(nullptr, "", "e", false);
  Json out = {{"stale", 1}};  // whatever the caller passes is replaced
  empty.ToJson(out);
  EXPECT_TRUE(out.is_null());

  pm::cfg::Object typed(nullptr, "static_text", "t", false);
  typed.ToJson(out);
  EXPECT_EQ(out, (Json{{"type", "static_text"}}));

  Root root(false);
  root.ToJson(out);
  EXPECT_FALSE(out.contains("type"));
}

TEST(ObjectToJson, EmptyChildOfOrderedParentStillGetsItsOrder) {
  struct R : pm::cfg::Object {
    R() : Object(nullptr, "", "r", true) {}
    pm::cfg::Object empty{this, "", "e", false};
  } root;
  Json out;
  root.ToJson(out);
  EXPECT_EQ(out, (Json{{"e", {{"pm::order", 0}}}}));
}

TEST(ObjectToJson, ChildWritingANonObjectInOrderedParentDoesNotThrow) {
  struct ArrayChild : pm::cfg::Object {
    explicit ArrayChild(Object* parent) : Object(parent, "", "arr", false) {}
    void ToJson(Json& out) override { out = Json::array({1}); }
  };
  struct R : pm::cfg::Object {
    R() : Object(nullptr, "", "r", true) {}
    ArrayChild child{this};
  } root;
  Json out;
  EXPECT_NO_THROW(root.ToJson(out));
  EXPECT_EQ(out, (Json{{"arr", {1}}}));
}

TEST(ObjectToJson, ChildKeyReplacesMemberOfTheSameName) {
  struct R : pm::cfg::Object {
    R() : Object(nullptr, "", "r", false) {}
    pm::cfg::MemberT<std::string> clash{this, "x", "member"};
    Leaf child{this, "x"};
  } root;
  Json out;
  root.ToJson(out);
  EXPECT_EQ(out, (Json{{"x", {{"n", 0}, {"type", "leaf"}}}}));
}

// ---------------------------------------------------------------------------
// Reading

TEST(ObjectFromJson, ReadsMembersAndChildrenAndIgnoresUnknownKeys) {
  Root root(false);
  root.FromJson(Json::parse(R"({"flag":false,"b":{"n":5,"zz":1},"x":1,"text":"new","n":9})"));
  EXPECT_FALSE(root.flag.value);
  EXPECT_EQ(root.text.value, "new");
  EXPECT_EQ(root.b.n.value, 5);
  EXPECT_EQ(root.a.n.value, 0);  // top-level "n" belongs to no member of the root
  EXPECT_EQ(root.c.n.value, 0);
}

TEST(ObjectFromJson, MissingKeysLeaveValuesUnchanged) {
  Root root(false);
  root.text.value = "kept";
  root.a.n.value = 3;
  root.FromJson(Json::object({{"flag", false}}));
  EXPECT_EQ(root.text.value, "kept");
  EXPECT_EQ(root.a.n.value, 3);
}

TEST(ObjectFromJson, NonObjectInputChangesNothing) {
  for (const Json& in : {Json(nullptr), Json(1), Json(-2.5), Json("flag"), Json(true),
                         Json::array({false, "x"}), Json::parse(R"([{"flag":false}])")}) {
    SCOPED_TRACE(in.dump());
    Root root(false);
    root.a.n.value = 4;
    EXPECT_NO_THROW(root.FromJson(in));
    EXPECT_TRUE(root.flag.value);
    EXPECT_EQ(root.text.value, "t");
    EXPECT_EQ(root.a.n.value, 4);
  }
}

TEST(ObjectFromJson, ChildGivenANonObjectKeepsItsValues) {
  Root root(false);
  root.a.n.value = 4;
  root.FromJson(Json::parse(R"({"a":[{"n":1}],"b":7,"c":null})"));
  EXPECT_EQ(root.a.n.value, 4);
  EXPECT_EQ(root.b.n.value, 0);
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

TEST(Members, BoolReadsLeniently) {
  Values m;
  const std::pair<Json, bool> cases[] = {
      {"Yes", true}, {"yes please", false}, {0.5, true}, {"1", true}, {0, false},
      {nullptr, false}, {Json::object(), false}, {18446744073709551615u, true},
  };
  for (const auto& [in, expected] : cases) {
    SCOPED_TRACE(in.dump());
    m.b.value = !expected;
    m.b.FromJson(in);
    EXPECT_EQ(m.b.value, expected);
  }
}

TEST(Members, IntegerReadsLeniently) {
  Values m;
  const std::pair<Json, std::int64_t> cases[] = {
      {"42abc", 42}, {2.9, 2}, {-2.9, -2}, {true, 1}, {"x", 0}, {nullptr, 0}, {1e300, 0},
      {-9223372036854775807 - 1, INT64_MIN},
  };
  for (const auto& [in, expected] : cases) {
    SCOPED_TRACE(in.dump());
    m.i.value = 77;
    m.i.FromJson(in);
    EXPECT_EQ(m.i.value, expected);
  }
}

TEST(Members, StringReadsLeniently) {
  Values m;
  const std::pair<Json, std::string> cases[] = {
      {true, "1"}, {12, "12"}, {nullptr, ""}, {-3, "-3"}, {2.5, "2.5"}, {Json::object({{"a", 1}}), ""},
  };
  for (const auto& [in, expected] : cases) {
    SCOPED_TRACE(in.dump());
    m.s.value = "init";
    m.s.FromJson(in);
    EXPECT_EQ(m.s.value, expected);
  }
}

TEST(Members, VectorReplacesItsContentsAndTakesScalarsAsOneElement) {
  Values m;
  m.v.FromJson(Json::array({"a", 5}));
  EXPECT_EQ(m.v.value, (std::vector<std::string>{"a", "5"}));
  m.v.FromJson("a");
  EXPECT_EQ(m.v.value, (std::vector<std::string>{"a"}));
  m.v.FromJson(Json::array());
  EXPECT_TRUE(m.v.value.empty());
  m.v.FromJson(Json::array({Json::array({"nested"}), true}));  // no flattening
  EXPECT_EQ(m.v.value, (std::vector<std::string>{"", "1"}));
  EXPECT_EQ(m.v.ToJson(), Json::array({"", "1"}));
  EXPECT_TRUE(Json(m.v.ToJson()).is_array());
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
  Json out;
  e.ToJson(out);
  EXPECT_EQ(out, (Json{{"ind", 12345}}));
  e.ind = pm::cfg::VisualIndication::None;
  e.FromJson(Json::parse(R"({"ind":[]})"));
  EXPECT_EQ(e.ind.value, 0);
}

// ---------------------------------------------------------------------------
// Hostile input: any JSON type anywhere, deep and huge values.

TEST(HostileInput, AnyJsonTypeAnywhereNeverThrows) {
  const Json odd[] = {nullptr, true, -1, 18446744073709551615u, 1e308, -0.0, "", "\xFF\xFE",
                      Json::array(), Json::object(), Json::array({Json::object({{"value", 1}})})};
  for (const Json& v : odd) {
    SCOPED_TRACE(v.dump(-1, ' ', false, Json::error_handler_t::replace));
    Root root(true);
    Values values;
    Json everywhere = Json::object();
    for (const char* key : {"flag", "text", "a", "b", "c", "b", "i", "s", "v"}) everywhere[key] = v;
    everywhere["a"] = Json{{"n", v}, {"type", v}, {"pm::order", v}};
    EXPECT_NO_THROW(root.FromJson(v));
    EXPECT_NO_THROW(root.FromJson(everywhere));
    EXPECT_NO_THROW(values.FromJson(everywhere));
    Json out;
    EXPECT_NO_THROW(root.ToJson(out));
    EXPECT_NO_THROW(values.ToJson(out));
  }
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
// FromJsonText

struct TextGui : pm::cfg::Gui {
  TextGui() : Gui(nullptr, "", "gui", true) {}
  pm::cfg::Popup choice{this, "choice", "t", {"a", "b", "c"}};
  pm::cfg::StaticText line{this, "line", "t"};
};

TEST(FromJsonText, TextThatIsNotJsonKeepsValuesValidatesAndLogsOnce) {
  pmtest::LogCapture capture;
  TextGui gui;
  gui.line.value = "kept";
  gui.choice.value = 7;  // out of range: Validate must still run
  gui.FromJsonText(R"({"line":{"value":"lost")", "UpdateConfiguration");
  EXPECT_EQ(gui.line.value.value, "kept");
  EXPECT_EQ(gui.choice.value.value, 0);
  EXPECT_EQ(capture.Lines(),
            (std::vector<std::string>{"pmjson::Parse failed: UpdateConfiguration '{\"line\":{\"value\":\"lost\"'\n"}));
}

TEST(FromJsonText, EmptyTextValidatesWithoutALogLine) {
  pmtest::LogCapture capture;
  TextGui gui;
  gui.choice.value = -1;
  gui.line.value = "kept";
  gui.FromJsonText("");
  EXPECT_EQ(gui.choice.value.value, 0);
  EXPECT_EQ(gui.line.value.value, "kept");
  EXPECT_TRUE(capture.Lines().empty());
}

TEST(FromJsonText, ValidTextIsRead) {
  TextGui gui;
  gui.FromJsonText(R"({"choice":{"value":"2"},"line":{"value":12}})");
  EXPECT_EQ(gui.choice.SelectedText(), "c");
  EXPECT_EQ(gui.line.value.value, "12");
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

TEST(FromJsonText, GarbageTextNeverThrows) {
  pmtest::LogCapture capture;
  TextGui gui;
  for (const std::string& text : {std::string("\0\1", 2), std::string("\xC3\x28"), std::string(50000, '{'),
                                  std::string("[1,2"), std::string("null"), std::string("42")}) {
    EXPECT_NO_THROW(gui.FromJsonText(text));
  }
  EXPECT_EQ(gui.choice.value.value, 0);
}

}  // namespace
