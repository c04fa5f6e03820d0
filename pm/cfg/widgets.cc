#include "pm/cfg/widgets.h"

namespace pm::cfg {

GuiWidget::GuiWidget(Object* parent, std::string type, std::string key)
    : Object(parent, std::move(type), std::move(key), /*ordered=*/false),
      visible(this, "visible", true),
      ghosted(this, "ghosted", false) {}

void GuiWidget::FromJson(const Json& in) {
  if (!in.is_object()) return;
  auto it = in.find("value");
  if (it == in.end()) return;
  if (Member* member = FindMember("value")) member->FromJson(*it);
}

Json GuiWidget::ValueJson() const {
  const Member* member = FindMember("value");
  return member ? member->ToJson() : Json();
}

StaticText::StaticText(Object* parent, std::string key, std::string titleText)
    : GuiWidget(parent, "static_text", std::move(key)),
      value(this, "value", std::string()),
      title(this, "title", std::move(titleText)),
      justification(this, "justification", Justify::Left),
      indication(this, "indication", VisualIndication::None) {}

Popup::Popup(Object* parent, std::string key, std::string titleText, std::vector<std::string> entries)
    : GuiWidget(parent, "popup", std::move(key)),
      value(this, "value", 0),
      title(this, "title", std::move(titleText)),
      values(this, "values", std::move(entries)),
      valueSetID(this, "valueSetID", std::string()) {}

void Popup::Validate() {
  GuiWidget::Validate();
  const auto count = static_cast<std::int64_t>(values.value.size());
  if (value.value < 0 || value.value >= count) value.value = 0;
}

void Popup::SelectText(const std::string& text) {
  for (std::size_t i = 0; i < values.value.size(); ++i) {
    if (values.value[i] == text) {
      value.value = static_cast<std::int64_t>(i);
      return;
    }
  }
}

std::string Popup::SelectedText() const {
  const std::int64_t index = value.value;
  if (index < 0 || static_cast<std::uint64_t>(index) >= values.value.size()) return {};
  return values.value[static_cast<std::size_t>(index)];
}

Button::Button(Object* parent, std::string key, std::string titleText, std::string commandName)
    : GuiWidget(parent, "button", std::move(key)),
      title(this, "title", std::move(titleText)),
      action(this, "action", kActionCustom),
      command(this, "command", std::move(commandName)) {}

}  // namespace pm::cfg
