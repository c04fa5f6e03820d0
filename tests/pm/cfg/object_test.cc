// The configuration object model and the settings-dialog widgets: JSON form,
// reading (lenient members; of a widget only its value), FromJsonText, pop-up
// validation and selection, and FromGui. Any JSON anywhere never throwing is
// the json_cfg fuzzer's; the exact text of a whole dialog is pinned by the NDI
// source's panel test, and the pop-up's reading of an index by its
// configuration test.
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
  Root() : Object(nullptr, "", "root", false) {}
  pm::cfg::MemberT<bool> flag{this, "flag", true};
  pm::cfg::MemberT<std::string> text{this, "text", "t"};
  Leaf a{this, "a"};
  Leaf b{this, "b"};
};

// A dialog shaped like the NDI source's: ordered root "gui" with a bandwidth
// pop-up, a reconnect button and a status line.
struct SourceGui : pm::cfg::Gui {
  SourceGui() : Gui(nullptr, "", "gui", true) {}
  pm::cfg::Popup bandwidth{this, "bandwidth", "ndi_bandwidth_label",
                           {"ndi_bandwidth_highest", "ndi_bandwidth_lowest", "ndi_bandwidth_audio_only"}};
  pm::cfg::Button reconnect{this, "reconnect", "ndi_reconnect_button", "taskndisource::reconnect"};
  pm::cfg::StaticText status{this, "status", "p_status_label"};
};

Json Write(pm::cfg::Object& o, Json out = nullptr) {
  o.ToJson(out);
  return out;
}

// ---------------------------------------------------------------------------
// Writing and reading

// An ordered parent numbers its direct children in construction order (keys
// come out in byte order); grandchildren and unordered parents' children
// carry none; the type is written when there is one, and an object with
// neither type nor content is null (whatever the caller passed), yet
// numbered as a child.
TEST(ObjectToJson, WritesOrderTypeAndNullExactly) {
  struct Mid : pm::cfg::Object {
    explicit Mid(Object* parent) : Object(parent, "mid", "m", false) {}
    Leaf x{this, "x"};
  };
  struct OrderedRoot : pm::cfg::Object {
    OrderedRoot() : Object(nullptr, "", "r", true) {}
    Mid m{this};
    Leaf c{this, "c"};
    pm::cfg::Object empty{this, "", "e", false};
  } ordered;
  EXPECT_EQ(pmjson::Dump(Write(ordered)),
            R"({"c":{"n":0,"pm::order":1,"type":"leaf"},"e":{"pm::order":2},)"
            R"("m":{"pm::order":0,"type":"mid","x":{"n":0,"type":"leaf"}}})");
  pm::cfg::Object empty(nullptr, "", "e", false);
  EXPECT_TRUE(Write(empty, {{"stale", 1}}).is_null());
}

// Members and children are read by their keys; unknown and missing keys, and
// input of another shape, change nothing.
TEST(ObjectFromJson, ReadsMembersAndChildrenAndNothingElse) {
  Root root;
  root.a.n.value = 3;
  root.FromJson(Json::parse(R"({"flag":false,"b":{"n":5,"zz":1},"x":1,"text":"new","n":9})"));
  // "a" missing: unchanged.
  const Json read = Json::parse(R"({"flag":false,"text":"new","a":{"n":3,"type":"leaf"},"b":{"n":5,"type":"leaf"}})");
  EXPECT_EQ(Write(root), read);
  for (const Json& in : {Json(nullptr), Json("flag"), Json::parse(R"([{"flag":true}])"),
                         Json::parse(R"({"a":[{"n":1}],"b":7})")}) {
    root.FromJson(in);
    EXPECT_EQ(Write(root), read) << in.dump();
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

// Scalars read any JSON leniently; given an array a scalar takes its last
// element (an empty one clears it); a vector takes a scalar as one element
// and does not flatten.
TEST(Members, ReadAnyJsonLeniently) {
  Values m;
  ExpectReads<pm::cfg::MemberT<bool>, bool>(
      m.b, true, {{"Yes", true}, {"yes please", false}, {0.5, true}, {"1", true}, {0, false}, {nullptr, false},
                  {Json::object(), false}, {18446744073709551615u, true}, {Json::array(), false}});
  ExpectReads<pm::cfg::MemberT<bool>, bool>(m.b, false, {{"Yes", true}, {Json::parse(R"([false,"yes"])"), true}});
  ExpectReads<pm::cfg::MemberT<std::int64_t>, std::int64_t>(
      m.i, 77, {{"42abc", 42}, {2.9, 2}, {-2.9, -2}, {true, 1}, {"x", 0}, {nullptr, 0}, {1e300, 0},
                {-9223372036854775807 - 1, INT64_MIN}, {Json::parse(R"([1,"2",3.7])"), 3}, {Json::array(), 0}});
  ExpectReads<pm::cfg::MemberT<std::string>, std::string>(
      m.s, "init", {{true, "1"}, {12, "12"}, {nullptr, ""}, {-3, "-3"}, {2.5, "2.5"}, {Json::object({{"a", 1}}), ""},
                    {Json::array({"p", "q"}), "q"}, {Json::array(), ""}});
  using V = std::vector<std::string>;
  ExpectReads<pm::cfg::MemberVectorT<>, V>(
      m.v, V{"x"}, {{Json::array({"a", 5}), V{"a", "5"}}, {"a", V{"a"}}, {Json::array(), V{}},
                    {Json::array({Json::array({"nested"}), true}), V{"", "1"}}});
  EXPECT_EQ(m.v.ToJson(), Json::array({"", "1"}));
}

// Text nested deeper than the JSON limit is refused before a value is built
// (reading it would be safe, copying or printing it would not): the members
// keep their values and one line is logged.
TEST(HostileInput, TextNestedTooDeepIsRefusedAndTheValuesKept) {
  constexpr int kDepth = 200000;
  const std::string text = R"({"s":"x","i":)" + std::string(kDepth, '[') + "7" + std::string(kDepth, ']') + "}";
  pmtest::LogCapture capture;
  Values m, untouched;
  m.FromJsonText(text);
  EXPECT_EQ(Write(m), Write(untouched));
  EXPECT_EQ(capture.Lines().size(), 1u);
  EXPECT_EQ(capture.Count("nests deeper than 256 levels"), 1);
}

// ---------------------------------------------------------------------------
// FromJsonText: reads what parses, validates in every case (after a read that
// throws too), logs a bad text once.

TEST(FromJsonText, ReadsValidatesAndLogsBadText) {
  struct Case {
    const char* text;
    std::int64_t choice;  // after Validate
    const char* status;
    std::size_t lines;
  } cases[] = {
      {R"({"status":{"value":"lost")", 0, "kept", 1},
      {"", 0, "kept", 0},
      {R"({"bandwidth":{"value":"2"},"status":{"value":12}})", 2, "12", 0},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.text);
    pmtest::LogCapture capture;
    SourceGui gui;
    gui.status.value = "kept";
    gui.bandwidth.value = 7;  // out of range: Validate must still run
    gui.FromJsonText(c.text, "UpdateConfiguration");
    EXPECT_EQ(gui.bandwidth.value.value, c.choice);
    EXPECT_EQ(gui.status.value.value, c.status);
    EXPECT_EQ(capture.Lines().size(), c.lines);
  }
  struct Throwing : pm::cfg::Object {
    Throwing() : Object(nullptr, "", "t", false) {}
    void FromJson(const Json& in) override { (void)in.at("missing"); }  // strict read
    void Validate() override { ++validated; }
    int validated = 0;
  } t;
  pmtest::LogCapture capture;
  t.FromJsonText(R"({"a":1})", "label");
  EXPECT_EQ(t.validated, 1);
  EXPECT_EQ(capture.Count("pm::cfg::Object::FromJsonText: label: "), 1);
}

// ---------------------------------------------------------------------------
// Widgets

// Of what the host sends back only the value is taken: a title, a type, a
// button's command and the rest keep what the task set.
TEST(WidgetFromJson, ReadsOnlyTheValue) {
  SourceGui gui;
  Json expected = Write(gui);
  expected["bandwidth"]["value"] = 2;
  expected["status"]["value"] = "1";  // from an array: its last element
  Json host = expected;               // with everything else changed
  const Json changed = {{"title", "x"}, {"visible", false}, {"ghosted", true}, {"values", {"z"}},
                        {"valueSetID", "id"}, {"type", "button"}, {"justification", 99}, {"indication", 101},
                        {"action", 1}, {"command", "rm"}};
  for (const char* key : {"bandwidth", "reconnect", "status"}) host[key].update(changed);
  host["status"]["value"] = {"a", 2, true};
  host["reconnect"]["value"] = "v";
  gui.FromJson(host);
  EXPECT_EQ(Write(gui), expected);
  // Without a value, or not an object: the value stays.
  for (const Json& in : {Json::object({{"title", "x"}}), Json("value"), Json::array({Json{{"value", "x"}}})}) {
    gui.status.FromJson(in);
    gui.bandwidth.FromJson(in);
  }
  EXPECT_EQ(Write(gui), expected);
}

// A pop-up is an index into its entries; Validate resets one out of range to
// 0, SelectText picks the first entry equal byte for byte and ignores others,
// and the root validates after reading and before writing.
TEST(Popup, IndexValidationSelectionAndReading) {
  enum Op { kValidate, kSelect, kRead, kWrite };
  struct Case {
    std::vector<std::string> entries;
    std::int64_t start;
    Op op;
    const char* arg;  // the text to select, or the JSON to read
    std::int64_t value;
    const char* selected;
  } cases[] = {
      {{"a", "b", "c"}, 3, kValidate, "", 0, "a"},
      {{"a", "b", "c"}, INT64_MIN, kValidate, "", 0, "a"},
      {{"a", "b", "c"}, 3, kSelect, "b", 1, "b"},
      {{"a", "b", "c"}, 1, kSelect, "B", 1, "b"},
      {{"a", "b", "c"}, 3, kSelect, "x", 3, ""},
      {{"a", "b", "b"}, 0, kSelect, "b", 1, "b"},
      {{}, 0, kValidate, "", 0, ""},
      {{}, 0, kSelect, "a", 0, ""},
      {{"a", "b", "c"}, 1, kRead, R"({"p":{"value":18446744073709551615}})", 0, "a"},
      {{"a", "b", "c"}, -1, kWrite, "", 0, "a"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(testing::Message() << c.start << " " << c.op << " " << c.arg << " of " << c.entries.size());
    struct G : pm::cfg::Gui {
      explicit G(std::vector<std::string> entries) : Gui(nullptr, "", "gui", true), p(this, "p", "t", std::move(entries)) {}
      pm::cfg::Popup p;
    } gui(c.entries);
    gui.p.value = c.start;
    switch (c.op) {
      case kValidate: gui.p.Validate(); break;
      case kSelect: gui.p.SelectText(c.arg); break;
      case kRead: gui.FromJson(Json::parse(c.arg)); break;
      case kWrite: EXPECT_EQ(Write(gui)["p"]["value"], c.value); break;
    }
    EXPECT_EQ(gui.p.value.value, c.value);
    EXPECT_EQ(gui.p.SelectedText(), c.selected);
  }
}

// A member takes the value of the first direct child widget with its key
// (byte for byte), is cleared by a widget without a value, and is kept when
// only a non-widget or a grandchild has its key.
TEST(FromGui, CopiesTheValueOfTheFirstWidgetWithTheMembersKey) {
  struct G : SourceGui {
    G() {
      first.value = "first";
      second.value = "second";
      nested.value = "grandchild";
      bandwidth.value = 2;
    }
    pm::cfg::Object plain{this, "", "k", false};  // not a widget
    pm::cfg::StaticText first{this, "k", "t"};
    pm::cfg::StaticText second{this, "k", "t"};
    pm::cfg::Object group{this, "", "group", false};
    pm::cfg::StaticText nested{&group, "deep", "t"};
  } gui;
  struct Cfg : pm::cfg::Configuration {
    Cfg() : Configuration(nullptr, "", "configuration", false) {}
    pm::cfg::MemberT<std::string> k{this, "k", ""};
    pm::cfg::MemberT<std::string> deep{this, "deep", "kept"};
    pm::cfg::MemberT<std::string> K{this, "K", "kept"};
    pm::cfg::MemberT<std::int64_t> bandwidth{this, "bandwidth", 9};
    pm::cfg::MemberT<std::string> reconnect{this, "reconnect", "x"};
  } cfg;
  cfg.FromGui(gui);
  EXPECT_EQ(Write(cfg), (Json{{"k", "first"}, {"deep", "kept"}, {"K", "kept"}, {"bandwidth", 2}, {"reconnect", ""}}));
}

}  // namespace
