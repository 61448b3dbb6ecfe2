#include <gtest/gtest.h>

#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/writers.h"

namespace Pelmora {
namespace {

// A period that no block size divides, so that blocks read out of order show.
std::string Pattern(int length) {
   std::string text;
   for (int i = 0; i < length; ++i) text += static_cast<char>('a' + (i * 7 + i / 26) % 26);
   return text;
}

std::string ReadRest(WriteReadBuffer* buffer, int piece) {
   std::string all, chunk(piece, '\0');
   for (int count; (count = buffer->Read(chunk.data(), piece)) != -1;) {
      all.append(chunk, 0, count);
   }
   return all;
}

TEST(WriteReadBufferTest, ReadsBackWhatWasWrittenAcrossBlockBoundaries) {
   const std::string text = Pattern(3000);
   Ref<WriteReadBuffer> buffer;
   CreateWriteReadBuffer(buffer);
   buffer->Write(text.data(), 1024);  // fills the first block exactly
   for (int at = 1024; at < 3000; at += 700)
      buffer->Write(text.data() + at, std::min(700, 3000 - at));
   EXPECT_EQ(3000, buffer->GetSize());
   std::string head(1500, '\0');
   EXPECT_EQ(1500, buffer->Read(head.data(), 1500));
   EXPECT_EQ(text.substr(0, 1500), head);
   EXPECT_EQ(text.substr(1500), ReadRest(buffer.Get(), 999));

   buffer->Rewind();
   EXPECT_EQ(text, ReadRest(buffer.Get(), 4096));
   EXPECT_THROW(buffer->Read(head.data(), -1), InvalidArgumentException);
}

TEST(WriteReadBufferTest, TheFirstReadEndsWritingForGood) {
   Ref<WriteReadBuffer> buffer;
   CreateWriteReadBuffer(buffer);
   EXPECT_THROW(buffer->Write("d", -1), InvalidArgumentException);
   buffer->Write("abc", 3);
   buffer->Close();  // closing the writing side keeps the bytes
   char out[8];
   EXPECT_EQ(0, buffer->Read(out, 0));
   EXPECT_THROW(buffer->Write("d", 1), InvalidStateException);
   EXPECT_EQ(3, buffer->GetSize());
   EXPECT_EQ(3, buffer->Read(out, sizeof(out)));
   EXPECT_EQ(-1, buffer->Read(out, sizeof(out)));

   CreateWriteReadBuffer(buffer);
   EXPECT_EQ(-1, buffer->Read(out, sizeof(out)));  // empty, and now read-only
   EXPECT_THROW(buffer->Write("d", 1), InvalidStateException);
}

}  // namespace
}  // namespace Pelmora
