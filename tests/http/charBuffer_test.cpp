#include <gtest/gtest.h>

#include <string>

#include "src/http/charBuffer.h"
#include "tests/support/netFixture.h"

namespace Pelmora::Http {
namespace {

std::string Drain(CharBuffer& buffer) {
   buffer.Flip();
   std::string out;
   char piece[5];
   for (size_t n; (n = buffer.Get(piece, sizeof piece)) > 0;) out.append(piece, n);
   return out;
}

TEST(CharBufferTest, FixedTakesOnlyItsRoomAndPrependsIntoTheReserve) {
   FixedCharBuffer buffer(10, 4);
   EXPECT_EQ(buffer.Append("0123456789abc", 13), 10u);
   EXPECT_EQ(buffer.Append("x", 1), 0u);
   EXPECT_EQ(buffer.Prepend("AB", 2), 2u);
   EXPECT_EQ(buffer.Prepend("CDE", 3), 0u);  // all or nothing
   EXPECT_EQ(buffer.Prepend("CD", 2), 2u);
   EXPECT_EQ(buffer.PrependPosition(), 0u);
   EXPECT_EQ(Drain(buffer), "CDAB0123456789");
   buffer.Clear();
   EXPECT_EQ(buffer.PrependPosition(), 4u);
   EXPECT_EQ(buffer.Position(), 4u);
   EXPECT_EQ(buffer.Limit(), 14u);
   EXPECT_EQ(Drain(buffer), "");
}

TEST(CharBufferTest, CompactKeepsUnreadBytes) {
   FixedCharBuffer buffer(8, 2);
   buffer.Append("abcdefgh", 8);
   buffer.Flip();
   char out[3];
   ASSERT_EQ(buffer.Get(out, 3), 3u);
   buffer.Compact();
   EXPECT_EQ(buffer.Filled(), 5u);
   EXPECT_EQ(buffer.Append("XYZW", 4), 3u);
   EXPECT_EQ(Drain(buffer), "defghXYZ");
}

TEST(CharBufferTest, DynamicGrowsByBlocksUpToItsCapacity) {
   const size_t block = DynamicCharBuffer::kBlockSize;
   DynamicCharBuffer buffer(3 * block, 512);
   std::string data;
   for (size_t i = 0; i < 2 * block + 100; ++i) data += static_cast<char>('a' + i % 26);
   EXPECT_EQ(buffer.Append(data.data(), data.size()), data.size());
   EXPECT_EQ(buffer.BlockCount(), 3u);
   std::string rest(block, 'z');
   EXPECT_EQ(buffer.Append(rest.data(), rest.size()), block - 100);
   std::string head = "HEADER";
   EXPECT_EQ(buffer.Prepend(head.data(), head.size()), head.size());
   std::string all = Drain(buffer);
   ASSERT_EQ(all.size(), head.size() + 3 * block);
   EXPECT_EQ(all.substr(0, head.size() + data.size()), head + data);
}

TEST(CharBufferTest, WritesItsBytesToAStreamBothWays) {
   System::NetTesting::EnsurePool();
   Ref<System::Stream> a, b;
   System::CreateStreamPair(a, b);
   DynamicCharBuffer buffer(100000, 16);
   std::string data(40000, 'd');
   buffer.Append(data.data(), data.size());
   buffer.Prepend("H", 1);
   EXPECT_EQ(buffer.WriteTo(a.Get()), 40001u);
   EXPECT_EQ(buffer.Filled(), 0u);
   buffer.Append("tail", 4);
   System::NetTesting::Completion done;
   buffer.AsyncWriteInt(a.Get(), [&](Exception* error, int n) { done.Done(error, n); });
   std::string got;
   char piece[8192];
   while (got.size() < 40005) {
      int n = b->Read(piece, sizeof piece);
      ASSERT_GT(n, 0);
      got.append(piece, static_cast<size_t>(n));
   }
   ASSERT_TRUE(done.WaitCount(1));
   EXPECT_FALSE(done.Failed());
   EXPECT_EQ(done.Bytes(), 4);
   EXPECT_EQ(got, "H" + data + "tail");
   a->Close();
   System::NetTesting::Completion failed;
   buffer.Append("x", 1);
   buffer.AsyncWriteInt(a.Get(), [&](Exception* error, int n) { failed.Done(error, n); });
   ASSERT_TRUE(failed.WaitCount(1));
   EXPECT_TRUE(failed.Failed());
   b->Close();
}

}  // namespace
}  // namespace Pelmora::Http
