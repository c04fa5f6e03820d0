// Settings-dialog widgets: what FromJson reads, pop-up
// validation and selection, FromGui, and a whole dialog round trip with its
// exact JSON.
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

struct SourceConfig : pm::cfg::Configuration {
  SourceConfig() : Configuration(nullptr, "", "configuration", false) {}
  pm::cfg::MemberT<std::string> bandwidth{this, "bandwidth", "ndi_bandwidth_highest"};
};

Json Write(pm::cfg::Object& o) {
  Json out;
  o.ToJson(out);
  return out;
}

// ---------------------------------------------------------------------------
// What FromJson reads

TEST(WidgetFromJson, ReadsOnlyValue) {
  SourceGui gui;
  gui.bandwidth.FromJson(Json::parse(
      R"({"value":2,"title":"x","visible":false,"ghosted":true,"values":["z"],"valueSetID":"id","type":"button"})"));
  EXPECT_EQ(gui.bandwidth.value.value, 2);
  EXPECT_EQ(gui.bandwidth.title.value, "ndi_bandwidth_label");
  EXPECT_TRUE(gui.bandwidth.visible.value);
  EXPECT_FALSE(gui.bandwidth.ghosted.value);
  EXPECT_EQ(gui.bandwidth.values.value.size(), 3u);
  EXPECT_EQ(gui.bandwidth.valueSetID.value, "");
  EXPECT_EQ(gui.bandwidth.Type(), "popup");

  gui.status.FromJson(Json::parse(R"({"value":"s","justification":99,"indication":101,"title":"x"})"));
  EXPECT_EQ(gui.status.value.value, "s");
  EXPECT_EQ(gui.status.justification.Get(), pm::cfg::Justify::Left);
  EXPECT_EQ(gui.status.indication.Get(), pm::cfg::VisualIndication::None);
  EXPECT_EQ(gui.status.title.value, "p_status_label");
  gui.status.FromJson(Json::parse(R"({"value":["a",2,true]})"));  // an array: its last element
  EXPECT_EQ(gui.status.value.value, "1");
}

TEST(WidgetFromJson, MissingValueOrNonObjectLeavesTheValue) {
  SourceGui gui;
  gui.status.value = "kept";
  gui.bandwidth.value = 2;
  for (const Json& in : {Json::object({{"title", "x"}}), Json("value"), Json::array({Json{{"value", "x"}}}),
                         Json(nullptr)}) {
    gui.status.FromJson(in);
    gui.bandwidth.FromJson(in);
  }
  EXPECT_EQ(gui.status.value.value, "kept");
  EXPECT_EQ(gui.bandwidth.value.value, 2);
}

TEST(WidgetFromJson, ButtonHasNoValueAndReadingChangesNothing) {
  SourceGui gui;
  const Json before = Write(gui)["reconnect"];
  gui.reconnect.FromJson(Json::parse(
      R"({"value":"v","title":"x","action":1,"command":"rm","visible":false,"ghosted":true})"));
  EXPECT_EQ(Write(gui)["reconnect"], before);
  EXPECT_TRUE(gui.reconnect.ValueJson().is_null());
  EXPECT_EQ(gui.reconnect.FindMember("value"), nullptr);
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

TEST(FromGui, CopiesTheValueOfTheWidgetWithTheMembersKey) {
  struct Cfg : pm::cfg::Configuration {
    Cfg() : Configuration(nullptr, "", "configuration", false) {}
    pm::cfg::MemberT<std::string> status{this, "status", "old"};
    pm::cfg::MemberT<std::int64_t> bandwidth{this, "bandwidth", 9};
    pm::cfg::MemberT<std::string> untouched{this, "untouched", "same"};
  } cfg;
  SourceGui gui;
  gui.status.value = "ndi_state_idle";
  gui.bandwidth.value = 2;
  cfg.FromGui(gui);
  EXPECT_EQ(cfg.status.value, "ndi_state_idle");
  EXPECT_EQ(cfg.bandwidth.value, 2);
  EXPECT_EQ(cfg.untouched.value, "same");
}

TEST(FromGui, WidgetWithoutValueClearsTheMember) {
  struct Cfg : pm::cfg::Configuration {
    Cfg() : Configuration(nullptr, "", "configuration", false) {}
    pm::cfg::MemberT<std::string> reconnect{this, "reconnect", "x"};
  } cfg;
  SourceGui gui;
  cfg.FromGui(gui);
  EXPECT_EQ(cfg.reconnect.value, "");
}

TEST(FromGui, TakesTheFirstWidgetAndSkipsNonWidgetsAndGrandchildren) {
  struct Plain : pm::cfg::Object {
    explicit Plain(Object* parent) : Object(parent, "", "k", false) {}
    pm::cfg::MemberT<std::string> value{this, "value", "not a widget"};
  };
  struct Group : pm::cfg::Object {
    explicit Group(Object* parent) : Object(parent, "", "group", false) {}
    pm::cfg::StaticText nested{this, "deep", "t"};
  };
  struct G : pm::cfg::Gui {
    G() : Gui(nullptr, "", "gui", true) {
      first.value = "first";
      second.value = "second";
      group.nested.value = "grandchild";
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
    pm::cfg::MemberT<std::string> K{this, "K", "kept"};  // keys match byte for byte
  } cfg;
  cfg.FromGui(gui);
  EXPECT_EQ(cfg.k.value, "first");
  EXPECT_EQ(cfg.deep.value, "kept");
  EXPECT_EQ(cfg.K.value, "kept");
}

// ---------------------------------------------------------------------------
// A whole dialog and configuration, as the host and the task pass them around

TEST(RoundTrip, HostEditedDialogBecomesConfigurationAndBack) {
  // Task -> host: the dialog for a configuration selecting the lowest bandwidth.
  SourceConfig cfg;
  cfg.FromJsonText(R"({"bandwidth":"ndi_bandwidth_lowest","unknown":1})");
  SourceGui gui;
  gui.bandwidth.SelectText(cfg.bandwidth.value);
  gui.status.value = "taskvistafeed_status_error";
  gui.status.indication = pm::cfg::VisualIndication::Error;
  gui.video.value = "1920x1080 @ 29.97 fps";
  const std::string sent = pmjson::Dump(Write(gui));
  EXPECT_EQ(sent,
            R"({"audio":{"ghosted":false,"indication":0,"justification":108,"pm::order":4,)"
            R"("title":"ndi_audio_status_label","type":"static_text","value":"","visible":true},)"
            R"("bandwidth":{"ghosted":false,"pm::order":0,"title":"ndi_bandwidth_label","type":"popup",)"
            R"("value":1,"valueSetID":"","values":["ndi_bandwidth_highest","ndi_bandwidth_lowest",)"
            R"("ndi_bandwidth_audio_only"],"visible":true},)"
            R"("reconnect":{"action":1668641652,"command":"taskndisource::reconnect","ghosted":false,)"
            R"("pm::order":1,"title":"ndi_reconnect_button","type":"button","visible":true},)"
            R"("status":{"ghosted":false,"indication":101,"justification":108,"pm::order":2,)"
            R"("title":"p_status_label","type":"static_text","value":"taskvistafeed_status_error",)"
            R"("visible":true},)"
            R"("video":{"ghosted":false,"indication":0,"justification":108,"pm::order":3,)"
            R"("title":"ndi_video_status_label","type":"static_text","value":"1920x1080 @ 29.97 fps",)"
            R"("visible":true}})");

  // Reading our own text back into a fresh dialog takes every value; the
  // indication is the task's to set, not the host's.
  SourceGui same;
  same.FromJsonText(sent);
  EXPECT_EQ(same.status.indication.Get(), pm::cfg::VisualIndication::None);
  same.status.indication = pm::cfg::VisualIndication::Error;
  EXPECT_EQ(pmjson::Dump(Write(same)), sent);

  // Host -> task: the user picked audio-only; the host also sends back keys the
  // task owns, which must not be taken.
  Json edited = Json::parse(sent);
  edited["bandwidth"]["value"] = 2;
  edited["bandwidth"]["values"] = Json::array({"hacked"});
  edited["reconnect"]["command"] = "rm -rf";
  SourceGui back;
  back.FromJsonText(pmjson::Dump(edited));
  EXPECT_EQ(back.bandwidth.values.value.size(), 3u);
  EXPECT_EQ(back.reconnect.command.value, "taskndisource::reconnect");

  SourceConfig result;
  result.bandwidth.value = back.bandwidth.SelectedText();
  EXPECT_EQ(pmjson::Dump(Write(result)), R"({"bandwidth":"ndi_bandwidth_audio_only"})");

  // FromGui copies the pop-up's value as it stands: its index.
  SourceConfig generic;
  generic.FromGui(back);
  EXPECT_EQ(generic.bandwidth.value, "2");
}

}  // namespace
