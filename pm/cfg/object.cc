#include "pm/cfg/object.h"

#include <exception>

#include "pm/cfg/widgets.h"
#include "pm/runtime/log.h"

namespace pm::cfg {

Object::Object(Object* parent, std::string type, std::string key, bool ordered)
    : type_(std::move(type)), key_(std::move(key)), ordered_(ordered) {
  if (parent) parent->children_.push_back(this);
}

Object::~Object() = default;

void Object::VisitChildren() {
  for (Object* child : children_) child->VisitChildren();
}

void Object::Validate() {
  for (Object* child : children_) child->Validate();
}

void Object::ToJson(Json& out) {
  out = nullptr;
  if (!type_.empty()) out["type"] = type_;
  for (const Member* member : members_) out[member->name] = member->ToJson();
  std::int64_t index = 0;
  for (Object* child : children_) {
    Json j;
    child->ToJson(j);
    // A child that writes something other than an object (only a derived
    // ToJson could) has no place for its order; writing one would throw.
    if (ordered_ && (j.is_null() || j.is_object())) j["pm::order"] = index;
    out[child->key_] = std::move(j);
    ++index;
  }
}

void Object::FromJson(const Json& in) {
  if (!in.is_object()) return;
  for (Member* member : members_) {
    auto it = in.find(member->name);
    if (it != in.end()) member->FromJson(*it);
  }
  for (Object* child : children_) {
    auto it = in.find(child->key_);
    if (it != in.end()) child->FromJson(*it);
  }
}

void Object::FromJsonText(const std::string& text, const char* label) {
  try {
    const Json in = pmjson::Parse(text, label);
    // Parse has logged a text that is not JSON and given null; an empty or
    // "null" text reads as nothing as well.
    if (in.is_null()) {
      Validate();
    } else {
      FromJson(in);
    }
    return;
  } catch (const std::exception& e) {
    pm::Log(pm::LogType::Normal, "", "pm::cfg::Object::FromJsonText: %s: %s\n", label ? label : "",
            e.what());
  } catch (...) {
    pm::Log(pm::LogType::Normal, "", "pm::cfg::Object::FromJsonText: %s: unknown exception\n",
            label ? label : "");
  }
  try {
    Validate();
  } catch (...) {
    // Validate of this model never throws; a derived one that does must not
    // escape a call documented to return normally.
  }
}

Member* Object::FindMember(const std::string& name) const {
  for (Member* member : members_) {
    if (member->name == name) return member;
  }
  return nullptr;
}

Gui::Gui(Object* parent, std::string type, std::string key, bool ordered)
    : Object(parent, std::move(type), std::move(key), ordered) {}

void Gui::ToJson(Json& out) {
  Validate();
  Object::ToJson(out);
}

void Gui::FromJson(const Json& in) {
  Object::FromJson(in);
  Validate();
}

Configuration::Configuration(Object* parent, std::string type, std::string key, bool ordered)
    : Object(parent, std::move(type), std::move(key), ordered) {}

void Configuration::ToJson(Json& out) {
  Validate();
  Object::ToJson(out);
}

void Configuration::FromJson(const Json& in) {
  Object::FromJson(in);
  Validate();
}

void Configuration::FromGui(const Object& gui) {
  for (Member* member : Members()) {
    const GuiWidget* widget = nullptr;
    for (const Object* child : gui.Children()) {
      if (child->Key() != member->name) continue;
      widget = dynamic_cast<const GuiWidget*>(child);
      if (widget) break;
    }
    if (widget) member->FromJson(widget->ValueJson());
  }
}

Member::Member(Object* owner_, std::string name_) : owner(owner_), name(std::move(name_)) {
  if (owner) owner->members_.push_back(this);
}

Member::~Member() = default;

void Member::FromJson(const Json& value) {
  Clear();
  if (value.is_array()) {
    for (const Json& element : value) Assign(element);
  } else {
    Assign(value);
  }
}

}  // namespace pm::cfg
