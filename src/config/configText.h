#pragma once
// Checks of text that a configuration syntax must be able to carry.

#include <string_view>

namespace Pelmora::Service {

// Well-formed UTF-8 of characters XML allows (no control characters but tab, line feed
// and carriage return; no surrogates, U+FFFE or U+FFFF).
bool IsXmlText(std::string_view text);
// A name usable as an element tag: a letter, "_", ":" or non-ASCII character first, then
// also digits, "." and "-"; non-ASCII characters must be well-formed UTF-8.
bool IsXmlName(std::string_view name);

}  // namespace Pelmora::Service
