// The scan that skips the byte after each replaced byte; what each table escapes is checked
// through the canonicaliser against libxml2.

#include "src/c14n/escape.h"

#include <gtest/gtest.h>

#include <string>

#include "pelmora/io.h"

using namespace Pelmora;
using namespace Pelmora::Xml::Security;

namespace {

std::string Text(const std::string& value) {
   std::string out;
   CanonicalizeStringValue(value.data(), value.size(), textCharReplacements, kTextCharReplacementRows, out);
   return out;
}

std::string Attribute(const std::string& value) {
   std::string out;
   CanonicalizeStringValue(value.data(), value.size(), attributeCharReplacements, kAttributeCharReplacementRows,
                           out);
   return out;
}

TEST(EscapeTest, ByteAfterAReplacedByteIsWrittenUnexamined) {
   EXPECT_EQ("&lt;<&lt;<", Text("<<<<"));
   EXPECT_EQ("&lt;<&lt;", Text("<<<"));
   EXPECT_EQ("&amp;\"&quot;", Attribute("&\"\""));
   // A special byte at the very end still ends the run correctly.
   EXPECT_EQ("ab&gt;", Text("ab>"));
}

TEST(EscapeTest, OtherTablesAreScannedRowByRow) {
   const CharToEntityReplacement table[] = {{'a', "[A]", 3}, {'b', "[B]", 3}};
   std::string out;
   CanonicalizeStringValue("xaby b", 6, table, 2, out);
   EXPECT_EQ("x[A]by [B]", out);
}

TEST(EscapeTest, WriterFormWritesTheSameBytes) {
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   CanonicalizeStringValue(std::string("1<<2>\"3"), attributeCharReplacements, kAttributeCharReplacementRows,
                           *writer);
   EXPECT_EQ("1&lt;<2&gt;\"3", writer->GetString());
}

}  // namespace
