#include <gtest/gtest.h>

#include <string>

#include "pelmora/http/header.h"
#include "src/http/requestScan.h"

namespace Pelmora::Http {
namespace {

int ScanAll(const std::string& text) {
   HeaderScanner scanner;
   return scanner.Scan(text.data(), static_cast<int>(text.size()));
}

TEST(RequestScanTest, HeaderEndsAtTheFirstBlankLineAfterContent) {
   EXPECT_EQ(ScanAll("GET / HTTP/1.1\r\n\r\nbody"), 18);
   // Body bytes that arrive with the header may hold NUL.
   EXPECT_EQ(ScanAll(std::string("GET / HTTP/1.1\r\n\r\n\0body", 23)), 18);
   EXPECT_EQ(ScanAll("\r\n\n \r\nGET / HTTP/1.1\r\n\r\n"), 24);
   HeaderScanner scanner;
   scanner.Scan("\r\n\n", 3);
   scanner.Scan(" \r\nG", 4);
   EXPECT_EQ(scanner.ContentStart(), 6);
   // A line of spaces and CR is blank; LF alone ends lines too.
   EXPECT_EQ(ScanAll("GET / HTTP/1.1\nA: b\n  \r \nrest"), 25);
   EXPECT_EQ(ScanAll("GET / HTTP/1.1\r\nA: b\r\n"), -1);
   EXPECT_EQ(ScanAll("\r\n\r\n\r\n"), -1);
   // A TAB is content.
   EXPECT_EQ(ScanAll("GET /\r\n\t\r\n\r\n"), 12);
}

TEST(RequestScanTest, EndIsFoundWhateverTheSplit) {
   const std::string text = "\r\nPOST /p HTTP/1.1\r\nHost: h\r\n \r\nBODY";
   for (size_t split = 0; split <= text.size(); ++split) {
      HeaderScanner scanner;
      int first = scanner.Scan(text.data(), static_cast<int>(split));
      int end = first >= 0 ? first : static_cast<int>(split) + scanner.Scan(text.data() + split, static_cast<int>(text.size() - split));
      EXPECT_EQ(end, static_cast<int>(text.size()) - 4) << split;
   }
}

TEST(RequestScanTest, NulAnywhereFails) {
   std::string text = "GET / HTTP/1.1\r\n\r\n";
   for (size_t at = 0; at + 1 < text.size(); ++at) {
      std::string bad = text;
      bad[at] = '\0';
      try {
         ScanAll(bad);
         FAIL() << at;
      } catch (const MalformedHeaderException& e) {
         EXPECT_EQ(e.GetMessage(), "invalid value 0 ");
      }
   }
}

std::string Decode(ChunkedBodyDecoder& decoder, const std::string& wire, size_t piece, size_t outSize,
                   size_t& consumed) {
   std::string body;
   consumed = 0;
   char out[64];
   while (consumed < wire.size() && !decoder.IsDone()) {
      size_t n = std::min(piece, wire.size() - consumed);
      size_t produced = 0;
      size_t used = decoder.Decode(wire.data() + consumed, n, out, std::min(outSize, sizeof out), produced);
      body.append(out, produced);
      consumed += used;
      if (used == 0 && produced == 0) break;
   }
   return body;
}

TEST(RequestScanTest, ChunkedBodyWithExtensionsAndTrailersInAnyPieces) {
   const std::string message = "4;name=val\r\nWiki\r\n5 \r\npedia\r\n000e\r\n in\r\n\r\nchunks.\r\n0;last\r\nX-Trailer: 1\r\nY: 2\r\n\r\n";
   const std::string wire = message + "NEXT";
   for (size_t piece = 1; piece < 12; ++piece) {
      for (size_t outSize : {1, 3, 64}) {
         ChunkedBodyDecoder decoder;
         size_t consumed = 0;
         EXPECT_EQ(Decode(decoder, wire, piece, outSize, consumed), "Wikipedia in\r\n\r\nchunks.");
         EXPECT_TRUE(decoder.IsDone());
         EXPECT_EQ(consumed, message.size());
      }
   }
}

TEST(RequestScanTest, MalformedChunkFraming) {
   const std::string cases[] = {
      std::string(511, '1') + "\n",       // 512 characters on a size line
      "\r\n",                              // no size
      "zz\r\n",                            // not hexadecimal
      "1\r\nabX",                          // data not followed by a line end
      "1000000000000000\r\n",              // too large
      "0\r\n" + std::string(10241, 't'),   // endless trailer line
   };
   for (const std::string& wire : cases) {
      ChunkedBodyDecoder decoder;
      size_t consumed = 0;
      try {
         Decode(decoder, wire, wire.size(), 64, consumed);
         FAIL() << wire.substr(0, 20);
      } catch (const Exception& e) {
         EXPECT_EQ(e.GetMessage(), "Malformed chunk header.");
      }
   }
   // 511 characters before the LF are still a size line.
   ChunkedBodyDecoder decoder;
   std::string wire = "1;" + std::string(509, 'e') + "\nA\r\n0\r\n\r\n";
   size_t consumed = 0;
   EXPECT_EQ(Decode(decoder, wire, wire.size(), 64, consumed), "A");
   EXPECT_TRUE(decoder.IsDone());
}

}  // namespace
}  // namespace Pelmora::Http
