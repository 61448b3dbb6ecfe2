#include <gtest/gtest.h>

#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/readers.h"
#include "pelmora/io/writers.h"

namespace Pelmora {
namespace {

TEST(StringWriterTest, CollectsEveryByteWrittenUntilReset) {
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   writer->Write("ab", 2);
   writer->Write("c\0d", 3);  // embedded zero bytes are data too
   EXPECT_EQ(std::string("abc\0d", 5), writer->GetString());
   EXPECT_EQ(5, writer->GetLength());
   EXPECT_THROW(writer->Write("a", -1), InvalidArgumentException);

   writer->Reset();
   EXPECT_EQ(0, writer->GetLength());
   writer->Write("xyz", 2);
   EXPECT_EQ("xy", writer->GetString());
}

TEST(StringReaderTest, ReadsTheCallersBytesInPlaceAndAnswersMinusOneAtTheEnd) {
   char text[] = "hello";
   Ref<StringReader> reader;
   CreateStringReader(text, 5, reader);
   char buffer[16] = {};
   EXPECT_EQ(0, reader->Read(buffer, 0));  // nothing asked is not the end
   EXPECT_EQ(2, reader->Read(buffer, 2));
   text[2] = 'L';  // not copied: the change is seen
   EXPECT_EQ(3, reader->Read(buffer, sizeof(buffer)));
   EXPECT_EQ("Llo", std::string(buffer, 3));
   EXPECT_EQ(-1, reader->Read(buffer, sizeof(buffer)));
   EXPECT_EQ(-1, reader->Read(buffer, 0));
   EXPECT_THROW(reader->Read(buffer, -1), InvalidArgumentException);

   reader->SetSource("xy", 2);  // rebinding rewinds
   EXPECT_EQ(2, reader->Read(buffer, sizeof(buffer)));
   EXPECT_EQ("xy", std::string(buffer, 2));
   EXPECT_THROW(reader->SetSource(nullptr, 3), InvalidArgumentException);
   EXPECT_THROW(CreateStringReader("abc", -1, reader), InvalidArgumentException);
   reader->Close();
   EXPECT_EQ(-1, reader->Read(buffer, sizeof(buffer)));
}

}  // namespace
}  // namespace Pelmora
