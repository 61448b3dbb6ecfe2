#include <gtest/gtest.h>

#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/writers.h"

namespace Pelmora {
namespace {

const std::string marker("**********\0\0\0", 13);
const std::string zeros(13, '\0');

// The ring and its 13 spare bytes as they stand in memory.
std::string Memory(RingBufferWriter& ring) {
   return std::string(ring.GetBufferStart(), ring.GetRingSize() + 13);
}

std::string Letters(int length) {
   std::string text;
   for (int i = 0; i < length; ++i) text += static_cast<char>('a' + i % 26);
   return text;
}

TEST(RingBufferWriterTest, EveryWriteLeavesTheMarkerAtTheWritePosition) {
   Ref<RingBufferWriter> ring;
   CreateRingBufferWriter(40, ring);
   EXPECT_EQ(std::string(53, '\0'), Memory(*ring));
   const std::string text = Letters(40);
   for (int length : {0, 7, 13, 1, 19, 40, 3, 38, 2, 25, 15, 39}) {
      SCOPED_TRACE(length);
      ring->Write(text.data(), length);
      EXPECT_LE(ring->GetCurrentWritePointer() - ring->GetBufferStart(), 40);
      EXPECT_EQ(marker, std::string(ring->GetCurrentWritePointer(), 13));
   }
   ring->Reset();
   EXPECT_EQ(ring->GetBufferStart(), ring->GetCurrentWritePointer());
   EXPECT_EQ(std::string(53, '\0'), Memory(*ring));
}

TEST(RingBufferWriterTest, WrapsOnlyWhenTheDataPassesTheEnd) {
   Ref<RingBufferWriter> ring;
   CreateRingBufferWriter(30, ring);
   ring->Write(Letters(25).data(), 25);  // the marker reaches into the spare bytes
   EXPECT_EQ(Letters(25) + marker + std::string(5, '\0'), Memory(*ring));

   ring->Write("0123456789", 10);
   EXPECT_EQ("56789" + marker + Letters(25).substr(18) + "01234" + zeros, Memory(*ring));

   ring->Write(Letters(25).data(), 25);  // ends exactly at the ring's end: no wrap
   EXPECT_EQ("56789" + Letters(25) + marker, Memory(*ring));

   ring->Write("XY", 2);  // wraps at once, and the stale marker past the end is cleared
   EXPECT_EQ("XY" + marker + Letters(25).substr(10) + zeros, Memory(*ring));
}

TEST(RingBufferWriterTest, RejectsPiecesLargerThanTheRingAndBadSizes) {
   Ref<RingBufferWriter> ring;
   CreateRingBufferWriter(8, ring);
   try {
      ring->Write(Letters(9).data(), 9);
      ADD_FAILURE() << "a piece larger than the ring was accepted";
   } catch (const NotSupportedException& e) {
      EXPECT_EQ("Not Supported", e.GetMessage());
   }
   EXPECT_THROW(ring->Write("a", -1), InvalidArgumentException);
   EXPECT_EQ(std::string(21, '\0'), Memory(*ring));
   EXPECT_THROW(CreateRingBufferWriter(0, ring), InvalidArgumentException);
   EXPECT_THROW(CreateRingStringWriter(-3, ring), InvalidArgumentException);
}

TEST(RingStringWriterTest, GetTextGivesTheHeldBytesOldestFirst) {
   Ref<RingStringWriter> ring;
   CreateRingStringWriter(20, ring);
   EXPECT_EQ("", ring->GetText());
   ring->Write("abcdefghij", 10);
   EXPECT_EQ("abcdefghij", ring->GetText());  // never-written bytes are not text
   ring->Write("klmnopqrst", 10);
   EXPECT_EQ("abcdefghijklmnopqrst", ring->GetText());  // the marker lies past the end
   ring->Write("UV", 2);
   EXPECT_EQ("pqrstUV", ring->GetText());  // the marker covers c..o
   ring->Write("0123456789", 10);
   EXPECT_EQ("UV0123456789", ring->GetText());  // the marker reaches past the end

   // Whatever the pieces, the text is the newest bytes written, short of the marker only.
   std::string written = "UV0123456789";
   for (int i = 0; i < 60; ++i) {
      std::string piece = "w" + std::to_string(i) + std::string(i % 9, '.');
      ring->Write(piece.data(), static_cast<int>(piece.size()));
      written += piece;
      const std::string text = ring->GetText();
      ASSERT_GE(text.size(), 20u - 13u) << i;
      EXPECT_EQ(written.substr(written.size() - text.size()), text) << i;
   }
   ring->Reset();
   EXPECT_EQ("", ring->GetText());
}

}  // namespace
}  // namespace Pelmora
