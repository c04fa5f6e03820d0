#pragma once
// Settings-dialog widgets. A dialog is a Gui root (pm/cfg/object.h) whose
// children are widgets; the host renders the dialog from the widgets' JSON and
// sends the edited JSON back, from which only each widget's "value" is taken.
//
// JSON of each widget (keys in byte order; "pm::order" comes from the ordered
// parent):
//   static text: "ghosted" bool, "indication" int, "justification" int,
//                "pm::order", "title" string, "type": "static_text",
//                "value" string, "visible" bool
//   pop-up:      "ghosted", "pm::order", "title", "type": "popup",
//                "value" int (selected index), "valueSetID" string,
//                "values" array of strings, "visible"
//   button:      "action" int, "command" string, "ghosted", "pm::order",
//                "title", "type": "button", "visible"  (no "value")
//
// Like every Object, widgets are neither copyable nor movable.

#include <cstdint>
#include <string>
#include <vector>

#include "pm/cfg/object.h"

namespace pm::cfg {

// A four-character code, first character in the most significant byte.
constexpr std::int64_t FourCC(char a, char b, char c, char d) {
  return (std::int64_t{static_cast<unsigned char>(a)} << 24) |
         (std::int64_t{static_cast<unsigned char>(b)} << 16) |
         (std::int64_t{static_cast<unsigned char>(c)} << 8) | std::int64_t{static_cast<unsigned char>(d)};
}

// Text alignment of a static text, as the character code of its letter.
enum class Justify : std::int64_t {
  Left = 'l',    // 108
  Center = 'c',  // 99
  Right = 'r',   // 114
};

// How the host highlights a static text, as the character code of its letter
// (None is 0).
enum class VisualIndication : std::int64_t {
  None = 0,
  Error = 'e',    // 101
  Warning = 'w',  // 119
  Success = 's',  // 115
};

// Action of a button that sends its command back to the task ('cust').
inline constexpr std::int64_t kActionCustom = FourCC('c', 'u', 's', 't');  // 1668641652

// Base of every widget: "visible" (true) and "ghosted" (false); not ordered.
struct GuiWidget : Object {
  GuiWidget(Object* parent, std::string type, std::string key);

  // Reads only "value": when `in` is an object with "value" and the widget
  // has a member named "value", that member's FromJson (clear, then lenient
  // assign). Everything else keeps the values the task set; a missing
  // "value" leaves the value unchanged.
  void FromJson(const Json& in) override;

  // The ToJson of the member named "value"; null when there is none (button).
  Json ValueJson() const;

  MemberT<bool> visible;
  MemberT<bool> ghosted;
};

// type "static_text"
struct StaticText : GuiWidget {
  StaticText(Object* parent, std::string key, std::string titleText);

  MemberT<std::string> value;               // empty
  MemberT<std::string> title;               // given
  MemberEnumT<Justify> justification;       // Justify::Left (108)
  MemberEnumT<VisualIndication> indication; // VisualIndication::None (0)
};

// type "popup"
struct Popup : GuiWidget {
  Popup(Object* parent, std::string key, std::string titleText, std::vector<std::string> entries);

  // A "value" below 0 or not below the number of entries becomes 0.
  void Validate() override;
  // Selects the first entry equal to `text` byte for byte; no match leaves
  // the selection unchanged.
  void SelectText(const std::string& text);
  // The selected entry, or empty when the index is out of range.
  std::string SelectedText() const;

  MemberT<std::int64_t> value;        // 0, index into values
  MemberT<std::string> title;         // given
  MemberVectorT<std::string> values;  // given
  MemberT<std::string> valueSetID;    // empty
};

// type "button"; has no "value".
struct Button : GuiWidget {
  Button(Object* parent, std::string key, std::string titleText, std::string commandName);

  MemberT<std::string> title;     // given
  MemberT<std::int64_t> action;   // kActionCustom
  MemberT<std::string> command;   // given
};

}  // namespace pm::cfg
