#include <gtest/gtest.h>

#include <string>

#include "pelmora/http/chunkStreamDecoder.h"
#include "pelmora/io/writers.h"

namespace Pelmora::Http {
namespace {

class ChunkStreamDecoderTest : public ::testing::Test {
protected:
   void SetUp() override {
      CreateStringWriter(_text);
      Service::CreateLogger(_text.Get(), "chunktest", "info", nullptr, _logger);
   }
   std::string Logged() { return _text->GetString(); }

   Ref<StringWriter> _text;
   Ref<Service::Logger> _logger;
};

TEST_F(ChunkStreamDecoderTest, FindsTheEndOfAMessageFedInAnyPieces) {
   const std::string message = "4;ext=1\r\nWiki\r\n5\r\npedia\r\nE\r\n in\r\n\r\nchunks.\r\n0\r\nX-T: 1\r\n\r\n";
   const std::string next = "GET / HTTP/1.1\r\n";
   const std::string wire = message + next;
   for (size_t piece = 1; piece <= wire.size(); ++piece) {
      ChunkStreamDecoder decoder(_logger.Get());
      size_t consumed = 0;
      for (size_t at = 0; at < wire.size() && !decoder.IsDone(); at += piece) {
         int n = static_cast<int>(std::min(piece, wire.size() - at));
         int used = decoder.ProcessBuffer(wire.data() + at, n);
         ASSERT_GE(used, 0) << Logged();
         consumed += static_cast<size_t>(used);
         if (!decoder.IsDone()) {
            ASSERT_EQ(used, n);
         }
      }
      EXPECT_TRUE(decoder.IsDone()) << piece;
      EXPECT_EQ(consumed, message.size()) << piece;
   }
   EXPECT_EQ(Logged(), "");
}

TEST_F(ChunkStreamDecoderTest, SizeLineFailuresAreLoggedWithTheirTexts) {
   struct Case {
      std::string input;
      const char* text;
   } cases[] = {
      {"1234567890123456789\r\n", "Chunk encoding failure: Header line too long"},
      {"\r\n", "Chunk encoding failure: Empty chunk header"},
      {";x\r\n", "Chunk encoding failure: Empty chunk header"},
      {"1g\r\n", "Chunk encoding failure: Encountered unexpected character 'g', expected chunk header"},
      {"1;" + std::string(10240, 'x'), "Chunk encoding failure: Maximum chunk header line length exceeded"},
      {"0\r\n" + std::string(10241, 'x'), "Chunk encoding failure: Maximum chunk trailer line length exceeded"},
      {"1\r\nab", "expected CR after chunk data"},
   };
   for (const Case& c : cases) {
      _text->Reset();
      ChunkStreamDecoder decoder(_logger.Get());
      EXPECT_EQ(decoder.ProcessBuffer(c.input.data(), static_cast<int>(c.input.size())), -1) << c.text;
      EXPECT_TRUE(decoder.HasFailed());
      EXPECT_NE(Logged().find(c.text), std::string::npos) << Logged();
      // Failed stays failed until rearmed.
      EXPECT_EQ(decoder.ProcessBuffer("0\r\n\r\n", 5), -1);
      decoder.NewChunkStreamStarted();
      EXPECT_EQ(decoder.ProcessBuffer("0\r\n\r\n", 5), 5);
      EXPECT_TRUE(decoder.IsDone());
   }
}

TEST_F(ChunkStreamDecoderTest, EighteenSizeDigitsAndLongLinesAtTheLimitAreAccepted) {
   ChunkStreamDecoder decoder(_logger.Get());
   std::string line = "000000000000000001;" + std::string(10240 - 20, 'e') + "\r\n";
   ASSERT_EQ(line.size(), 10241u);
   EXPECT_EQ(decoder.ProcessBuffer(line.data(), static_cast<int>(line.size())), static_cast<int>(line.size()))
      << Logged();
   EXPECT_EQ(decoder.GetState(), CHUNK_STREAM_DATA);
   std::string rest = "z\r\n0\r\n" + std::string(10240, 't') + "\r\n\r\n";
   EXPECT_EQ(decoder.ProcessBuffer(rest.data(), static_cast<int>(rest.size())), static_cast<int>(rest.size()));
   EXPECT_TRUE(decoder.IsDone());
}

}  // namespace
}  // namespace Pelmora::Http
