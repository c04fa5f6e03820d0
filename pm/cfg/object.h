#pragma once
// Configuration object model: a task describes its settings and its settings
// dialog as a tree of objects that serialises to a JSON object and reads back
// from one.
//
// An Object has a type (written as "type" when not empty), a key (the name
// under which its parent stores its JSON), named members (typed values) and
// child objects. Members and children are data members of the class that owns
// them; constructing one with an owner appends it to the owner's vector, so
// declaration order is vector order. The vectors only point at them.
//
// JSON objects keep their keys in ascending byte order, so declaration order
// is not visible in the JSON; the children of an ordered object carry their
// index as "pm::order" instead.
//
// Objects and members are neither copyable nor movable: members and children
// point at their owner and the owner's vectors point at them, so a copy would
// leave pointers into the original.
//
// Reading never fails and never throws: keys that match nothing are ignored,
// missing keys leave values unchanged, and values of any JSON type are
// converted by the lenient readers (pm/runtime/json.h).
//
// Threads: none inside; a tree is used by one thread at a time. Callers that
// share a tree across threads guard it themselves.
//
// Virtual operations are declared in their slot order; keep it.

#include <cstdint>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

#include "pm/runtime/json.h"

namespace pm::cfg {

using Json = nlohmann::json;

struct Member;

class Object {
 public:
  // A non-null parent gets this object appended to its children.
  Object(Object* parent, std::string type, std::string key, bool ordered);
  Object(const Object&) = delete;
  Object& operator=(const Object&) = delete;

  // slot 0
  virtual ~Object();
  // slot 1: VisitChildren on every child in order.
  virtual void VisitChildren();
  // slot 2: Validate on every child in order.
  virtual void Validate();
  // slot 3: out becomes null, then an object as soon as a key is written:
  // "type" when not empty, each member by name, then each child by key (a
  // child whose key equals a member's name replaces that entry), with
  // "pm::order" = index in the children of an ordered object. An object with
  // an empty type, no members and no children yields null.
  virtual void ToJson(Json& out);
  // slot 4: for each member, then each child, whose name or key `in` has,
  // that member's or child's FromJson with the value. A non-object `in`
  // changes nothing.
  virtual void FromJson(const Json& in);

  // Parses `text` (pmjson::Parse, which logs a text that is not JSON under
  // `label`) and calls FromJson with the result. A text that is not JSON, or
  // a FromJson that throws, leaves the values as they are and runs Validate
  // instead; nothing leaves this call.
  void FromJsonText(const std::string& text, const char* label = "FromJsonText");

  const std::string& Type() const { return type_; }
  const std::string& Key() const { return key_; }
  const std::vector<Member*>& Members() const { return members_; }
  const std::vector<Object*>& Children() const { return children_; }
  bool Ordered() const { return ordered_; }

  // The first member named `name`, or null.
  Member* FindMember(const std::string& name) const;

 private:
  friend struct Member;

  std::string type_;
  std::string key_;
  std::vector<Member*> members_;    // not owning, declaration order
  std::vector<Object*> children_;   // not owning, construction order
  bool ordered_;
};

// A dialog description root (and the base of dialog roots): ToJson validates
// first, FromJson validates after reading.
struct Gui : Object {
  Gui(Object* parent, std::string type, std::string key, bool ordered);
  void ToJson(Json& out) override;
  void FromJson(const Json& in) override;
};

// A settings root: like Gui, plus FromGui.
struct Configuration : Object {
  Configuration(Object* parent, std::string type, std::string key, bool ordered);
  void ToJson(Json& out) override;
  void FromJson(const Json& in) override;
  // slot 5: for each member m, the first direct child of `gui` that is a
  // GuiWidget with key == m's name gives its ValueJson (null when it has no
  // "value", which clears m) to m's FromJson. Members without such a widget
  // are left alone.
  virtual void FromGui(const Object& gui);
};

// A named value of an Object.
struct Member {
  // Appends this member to the owner's members (a null owner is allowed and
  // owns nothing).
  Member(Object* owner, std::string name);
  Member(const Member&) = delete;
  Member& operator=(const Member&) = delete;

  // slot 0
  virtual ~Member();
  // slot 1: Clear, then Assign each element of an array in order, or Assign
  // the value itself. A scalar member given an array ends with its last
  // element (an empty array leaves it cleared); a vector member given a
  // scalar ends with one element.
  virtual void FromJson(const Json& value);
  // slot 2
  virtual Json ToJson() const = 0;
  // slot 3
  virtual void Clear() = 0;
  // slot 4: the value read leniently (bool, integer or string reading).
  virtual void Assign(const Json& value) = 0;

  Object* owner;
  std::string name;
};

namespace detail {
template <typename T>
inline constexpr bool kMemberType =
    std::is_same_v<T, bool> || std::is_same_v<T, std::int64_t> || std::is_same_v<T, std::string>;

template <typename T>
T Read(const Json& value) {
  if constexpr (std::is_same_v<T, bool>) {
    return pmjson::AsBool(value);
  } else if constexpr (std::is_same_v<T, std::int64_t>) {
    return pmjson::AsInteger(value);
  } else {
    return pmjson::AsString(value);
  }
}
}  // namespace detail

// A bool, signed 64-bit or string value. Clear sets false, 0 or empty.
template <typename T>
struct MemberT : Member {
  static_assert(detail::kMemberType<T>, "MemberT holds bool, std::int64_t or std::string");

  MemberT(Object* owner, std::string name, T initial)
      : Member(owner, std::move(name)), value(std::move(initial)) {}

  MemberT& operator=(T v) {
    value = std::move(v);
    return *this;
  }

  Json ToJson() const override { return Json(value); }
  void Clear() override { value = T{}; }
  void Assign(const Json& v) override { value = detail::Read<T>(v); }

  T value;
};

// An enumeration held as a 64-bit integer (so values the enumeration does not
// name survive a round trip); written and read as a JSON integer.
template <typename E>
struct MemberEnumT : Member {
  static_assert(std::is_enum_v<E>, "MemberEnumT holds an enumeration");

  MemberEnumT(Object* owner, std::string name, E initial = E{})
      : Member(owner, std::move(name)), value(static_cast<std::int64_t>(initial)) {}

  MemberEnumT& operator=(E v) {
    value = static_cast<std::int64_t>(v);
    return *this;
  }
  E Get() const { return static_cast<E>(value); }

  Json ToJson() const override { return Json(value); }
  void Clear() override { value = 0; }
  void Assign(const Json& v) override { value = pmjson::AsInteger(v); }

  std::int64_t value;
};

// A list of values (strings unless said otherwise); Assign appends one
// element read leniently, Clear empties the list.
template <typename T = std::string>
struct MemberVectorT : Member {
  static_assert(detail::kMemberType<T>, "MemberVectorT holds bool, std::int64_t or std::string");

  MemberVectorT(Object* owner, std::string name, std::vector<T> initial = {})
      : Member(owner, std::move(name)), value(std::move(initial)) {}

  Json ToJson() const override {
    Json out = Json::array();
    for (const T& v : value) out.push_back(v);
    return out;
  }
  void Clear() override { value.clear(); }
  void Assign(const Json& v) override { value.push_back(detail::Read<T>(v)); }

  std::vector<T> value;
};

}  // namespace pm::cfg
