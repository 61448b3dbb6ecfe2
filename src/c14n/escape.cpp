#include "src/c14n/escape.h"

#include <array>
#include <cstdint>

namespace Pelmora::Xml::Security {

const CharToEntityReplacement textCharReplacements[kTextCharReplacementRows] = {
    {'&', "&amp;", 5},
    {'<', "&lt;", 4},
    {'>', "&gt;", 4},
    {'\r', "&#xD;", 5},
};

// ">" is escaped in attributes too, unlike the W3C algorithms: our peers' signatures
// cover "&gt;" there.
const CharToEntityReplacement attributeCharReplacements[kAttributeCharReplacementRows] = {
    {'&', "&amp;", 5},  {'<', "&lt;", 4},    {'>', "&gt;", 4},   {'"', "&quot;", 6},
    {'\t', "&#x9;", 5}, {'\n', "&#xA;", 5}, {'\r', "&#xD;", 5},
};

namespace {

// Row + 1 of each byte in a table, 0 for bytes it does not replace. The characters of a
// table are distinct, so this finds the same row as comparing each row in order.
using RowIndex = std::array<uint8_t, 256>;

RowIndex MakeIndex(const CharToEntityReplacement* table, int rows) {
   RowIndex index{};
   for (int row = rows - 1; row >= 0; --row) {
      index[static_cast<unsigned char>(table[row].character)] = static_cast<uint8_t>(row + 1);
   }
   return index;
}

const RowIndex kTextIndex = MakeIndex(textCharReplacements, kTextCharReplacementRows);
const RowIndex kAttributeIndex = MakeIndex(attributeCharReplacements, kAttributeCharReplacementRows);

template <class Find>
void Scan(const char* value, size_t length, const CharToEntityReplacement* table, Find find,
          std::string& out) {
   size_t run = 0;
   size_t i = 0;
   while (i < length) {
      int row = find(static_cast<unsigned char>(value[i]));
      if (row < 0) {
         ++i;
         continue;
      }
      out.append(value + run, i - run);
      out.append(table[row].replacement, table[row].length);
      run = i + 1;
      // The next byte goes out as it is, whatever it is.
      i += 2;
   }
   if (run < length) out.append(value + run, length - run);
}

}  // namespace

void CanonicalizeStringValue(const char* value, size_t length, const CharToEntityReplacement* table,
                             int rows, std::string& out) {
   const RowIndex* index = nullptr;
   if (table == textCharReplacements && rows == kTextCharReplacementRows) index = &kTextIndex;
   if (table == attributeCharReplacements && rows == kAttributeCharReplacementRows) index = &kAttributeIndex;
   if (index != nullptr) {
      Scan(value, length, table, [index](unsigned char c) { return int((*index)[c]) - 1; }, out);
      return;
   }
   Scan(value, length, table,
        [table, rows](unsigned char c) {
           for (int row = 0; row < rows; ++row) {
              if (static_cast<unsigned char>(table[row].character) == c) return row;
           }
           return -1;
        },
        out);
}

void CanonicalizeStringValue(const std::string& value, const CharToEntityReplacement* table,
                             int rows, Writer& writer) {
   std::string out;
   out.reserve(value.size() + 16);
   CanonicalizeStringValue(value.data(), value.size(), table, rows, out);
   writer.Write(out.data(), static_cast<int>(out.size()));
}

}  // namespace Pelmora::Xml::Security
