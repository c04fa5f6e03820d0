#pragma once
// Text conversion.
#include <string>
#include <string_view>

namespace pm {

// Decodes UTF-8 into UTF-16 (surrogate pairs above U+FFFF). Invalid input
// (bad lead or continuation bytes, truncated sequences, overlong forms,
// surrogate code points, values above U+10FFFF) throws
// std::range_error("bad conversion").
std::u16string Utf8ToUtf16(std::string_view utf8);

}  // namespace pm
