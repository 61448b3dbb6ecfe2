#pragma once
// The escaping tables of canonical output and the scan that applies them. The scan leaves
// the byte after a replaced byte unexamined, so "<<" becomes "&lt;<": canonical bytes that
// other implementations of our signatures produce and check, kept exactly so.

#include <string>

#include "pelmora/io/readerWriter.h"

namespace Pelmora::Xml::Security {

struct CharToEntityReplacement {
   char character;
   const char* replacement;
   int length;
};

inline constexpr int kTextCharReplacementRows = 4;
inline constexpr int kAttributeCharReplacementRows = 7;
extern const CharToEntityReplacement textCharReplacements[kTextCharReplacementRows];
extern const CharToEntityReplacement attributeCharReplacements[kAttributeCharReplacementRows];

// Appends `value` to `out`, escaped by `table`.
void CanonicalizeStringValue(const char* value, size_t length, const CharToEntityReplacement* table,
                             int rows, std::string& out);
void CanonicalizeStringValue(const std::string& value, const CharToEntityReplacement* table,
                             int rows, Writer& writer);

}  // namespace Pelmora::Xml::Security
