// Settings-dialog widgets: what FromJson reads (only values: what the host
// sends back of the rest is never taken), pop-up validation and selection, and
// FromGui. The exact text of a whole dialog is pinned by the NDI source's
// panel test.
#include <gtest/gtest.h>

#include "pm/cfg/object.h"
#include "pm/cfg/widgets.h"

namespace {

using pm::cfg::Json;

// A dialog shaped like the NDI source's: ordered root "gui" with a bandwidth
// pop-up, a reconnect button and three status lines.
struct SourceGui : pm::cfg::Gui {
  SourceGui() : Gui(nullptr, "", "gui", true) {}
  pm::cfg::Popup bandwidth{this, "bandwidth", "ndi_bandwidth_label",
                           {"ndi_bandwidth_highest", "ndi_bandwidth_lowest", "ndi_bandwidth_audio_only"}};
  pm::cfg::Button reconnect{this, "reconnect", "ndi_reconnect_button", "taskndisource::reconnect"};
  pm::cfg::StaticText status{this, "status", "p_status_label"};
  pm::cfg::StaticText video{this, "video", "ndi_video_status_label"};
  pm::cfg::StaticText audio{this, "audio", "ndi_audio_status_label"};
};

Json Write(pm::cfg::Object& o) {
  Json out;
  o.ToJson(out);
  return out;
}

// ---------------------------------------------------------------------------
// What FromJson reads

TEST(WidgetFromJson, ReadsOnlyTheValue) {
  SourceGui gui;
  Json expected = Write(gui);
  expected["bandwidth"]["value"] = 2;
  expected["status"]["value"] = "1";  // from an array: its last element
  Json host = expected;               // with everything else changed
  for (const char* key : {"bandwidth", "reconnect", "status"}) {
    host[key].update(Json{{"title", "x"}, {"visible", false}, {"ghosted", true}, {"values", {"z"}},
                          {"valueSetID", "id"}, {"type", "button"}, {"justification", 99}, {"indication", 101},
                          {"action", 1}, {"command", "rm"}});
  }
  host["status"]["value"] = {"a", 2, true};
  host["reconnect"]["value"] = "v";
  gui.FromJson(host);
  EXPECT_EQ(Write(gui), expected);
  EXPECT_TRUE(gui.reconnect.ValueJson().is_null());
  // Without a value, or not an object: the value stays.
  for (const Json& in : {Json::object({{"title", "x"}}), Json("value"), Json::array({Json{{"value", "x"}}}),
                         Json(nullptr)}) {
    gui.status.FromJson(in);
    gui.bandwidth.FromJson(in);
  }
  EXPECT_EQ(Write(gui), expected);
}

// ---------------------------------------------------------------------------
// Pop-up: an index into its entries; Validate resets one out of range to 0,
// SelectText picks the first entry equal byte for byte and ignores others,
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
      {{"a", "b", "c"}, 7, kValidate, "", 0, "a"},
      {{"a", "b", "c"}, 3, kValidate, "", 0, "a"},
      {{"a", "b", "c"}, -1, kValidate, "", 0, "a"},
      {{"a", "b", "c"}, INT64_MIN, kValidate, "", 0, "a"},
      {{"a", "b", "c"}, INT64_MAX, kValidate, "", 0, "a"},
      {{"a", "b", "c"}, 2, kValidate, "", 2, "c"},
      {{"a", "b", "c"}, 3, kSelect, "b", 1, "b"},
      {{"a", "b", "c"}, 1, kSelect, "B", 1, "b"},
      {{"a", "b", "c"}, 1, kSelect, "", 1, "b"},
      {{"a", "b", "c"}, 3, kSelect, "x", 3, ""},
      {{"a", "b", "c"}, -1, kSelect, "x", -1, ""},
      {{"a", "b", "b"}, 0, kSelect, "b", 1, "b"},
      {{}, 0, kValidate, "", 0, ""},
      {{}, 0, kSelect, "a", 0, ""},
      {{"a", "b", "c"}, 1, kRead, R"({"p":{"value":7}})", 0, "a"},
      {{"a", "b", "c"}, 1, kRead, R"({"p":{"value":18446744073709551615}})", 0, "a"},
      {{"a", "b", "c"}, 0, kRead, R"({"p":{"value":"2"}})", 2, "c"},
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

// ---------------------------------------------------------------------------
// FromGui

// A member takes the value of the first direct child widget with its key
// (byte for byte), is cleared by a widget without a value, and is kept when
// only a non-widget or a grandchild has its key.
TEST(FromGui, CopiesTheValueOfTheFirstWidgetWithTheMembersKey) {
  struct Plain : pm::cfg::Object {
    explicit Plain(Object* parent) : Object(parent, "", "k", false) {}
    pm::cfg::MemberT<std::string> value{this, "value", "not a widget"};
  };
  struct Group : pm::cfg::Object {
    explicit Group(Object* parent) : Object(parent, "", "group", false) {}
    pm::cfg::StaticText nested{this, "deep", "t"};
  };
  struct G : SourceGui {
    G() {
      first.value = "first";
      second.value = "second";
      group.nested.value = "grandchild";
      bandwidth.value = 2;
    }
    Plain plain{this};
    pm::cfg::StaticText first{this, "k", "t"};
    pm::cfg::StaticText second{this, "k", "t"};
    Group group{this};
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
  EXPECT_EQ(cfg.k.value, "first");
  EXPECT_EQ(cfg.deep.value, "kept");
  EXPECT_EQ(cfg.K.value, "kept");
  EXPECT_EQ(cfg.bandwidth.value, 2);
  EXPECT_EQ(cfg.reconnect.value, "");
}

}  // namespace
