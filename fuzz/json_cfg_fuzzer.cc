// JSON text into pmjson::Parse, every node of the result through the lenient
// readers, and the text and the value into pm::cfg trees: the NDI source's
// configuration and settings panel, and a tree with nested, ordered children
// and list members. Nothing may throw out of these.

#include <cstddef>
#include <cstdint>
#include <string>

#include "fuzz_support.h"
#include "pm/cfg/object.h"
#include "pm/cfg/widgets.h"
#include "pm/runtime/json.h"
#include "taskndisource/ndi_config.h"

namespace {

struct Inner : pm::cfg::Object {
  explicit Inner(pm::cfg::Object* parent, const char* key)
      : pm::cfg::Object(parent, "inner", key, /*ordered=*/false) {}
  pm::cfg::MemberT<bool> enabled{this, "enabled", false};
  pm::cfg::MemberVectorT<std::int64_t> numbers{this, "numbers"};
};

struct Tree : pm::cfg::Configuration {
  Tree() : pm::cfg::Configuration(nullptr, "tree", "tree", /*ordered=*/true) {}
  pm::cfg::MemberT<std::string> name{this, "name", "x"};
  pm::cfg::MemberT<std::int64_t> count{this, "count", 1};
  pm::cfg::MemberVectorT<std::string> tags{this, "tags"};
  Inner first{this, "first"};
  Inner second{this, "count"};  // a child key equal to a member's name
};

void ReadEverything(const pmjson::Json& value, int depth) {
  (void)pmjson::AsBool(value);
  (void)pmjson::AsInteger(value);
  (void)pmjson::AsDouble(value);
  (void)pmjson::AsString(value);
  for (const char* key : {"bandwidth", "value", "pm::order", "type"}) {
    (void)pmjson::FieldAsString(value, key, "d");
    (void)pmjson::FieldAsInteger(value, key, -1);
    (void)pmjson::FieldAsDouble(value, key, 0.5);
  }
  if (depth > 200) return;  // the walk itself is recursive; deeper nodes add nothing new
  if (value.is_object()) {
    for (auto it = value.begin(); it != value.end(); ++it) {
      (void)pmjson::FieldAsString(value, it.key(), "d");
      (void)pmjson::FieldAsInteger(value, it.key(), -1);
      (void)pmjson::FieldAsDouble(value, it.key(), 0.5);
      ReadEverything(it.value(), depth + 1);
    }
  } else if (value.is_array()) {
    for (const auto& element : value) ReadEverything(element, depth + 1);
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  pmfuzz::QuietLog();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string text(reinterpret_cast<const char*>(data), size);
  const pmjson::Json value = pmjson::Parse(text, "fuzz");
  ReadEverything(value, 0);
  (void)pmjson::Dump(value);

  TaskNDISource::NDISource::Config config;
  config.FromJson(value);
  config.FromJsonText(text, "fuzz config");
  pmjson::Json out;
  config.ToJson(out);
  (void)pmjson::Dump(out);
  (void)TaskNDISource::BandwidthFromText(config.bandwidth.value);

  TaskNDISource::NDISource::Gui gui;
  gui.FromJson(value);
  gui.FromJsonText(text, "fuzz gui");
  gui.ToJson(out);
  (void)pmjson::Dump(out);
  config.FromGui(gui);
  config.ToJson(out);

  Tree tree;
  tree.FromJson(value);
  tree.FromJsonText(text, "fuzz tree");
  tree.FromGui(gui);
  tree.ToJson(out);
  (void)pmjson::Dump(out);
  return 0;
}
