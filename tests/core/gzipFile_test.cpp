// The gzip reader and writer: what is deflated inflates to the same bytes, whatever the
// read sizes; members in a row read as one stream; damaged input names zlib's condition.

#include <zlib.h>

#include <random>
#include <string>

#include <gtest/gtest.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/gzip.h"
#include "pelmora/io/readers.h"
#include "pelmora/io/writers.h"

namespace Pelmora {
namespace {

std::string Deflate(const std::string& text, int chunk = 4096) {
   Ref<StringWriter> target;
   CreateStringWriter(target);
   Ref<Writer> gzip;
   CreateGzippedFileWriter(target.Get(), "mem", gzip);
   for (size_t at = 0; at < text.size(); at += chunk) {
      gzip->Write(text.data() + at, static_cast<int>(std::min<size_t>(chunk, text.size() - at)));
   }
   gzip->Close();
   return target->GetString();
}

std::string Inflate(const std::string& bytes, int readSize) {
   Ref<StringReader> source;
   CreateStringReader(bytes.data(), static_cast<int>(bytes.size()), source);
   Ref<Reader> gzip;
   CreateGzippedFileReader(source.Get(), "mem.gz", gzip);
   std::string out;
   std::string buffer(readSize, '\0');
   for (int n; (n = gzip->Read(buffer.data(), readSize)) >= 0;) out.append(buffer.data(), n);
   gzip->Close();
   return out;
}

// Text that compresses some but not to nothing: words from a small vocabulary.
std::string Text(size_t size) {
   std::mt19937 random(7);
   const char* words[] = {"pool ", "queue ", "thread ", "<a>", "</a>", "\n", "\x01 "};
   std::string text;
   while (text.size() < size) text += words[random() % 7];
   text.resize(size);
   return text;
}

TEST(GzipFileTest, RoundTripsAnySizeWithAnyReadSize) {
   for (size_t size : {size_t{0}, size_t{1}, size_t{65535}, size_t{700000}}) {
      std::string text = Text(size);
      std::string gz = Deflate(text, size % 2 ? 1 : 4096);
      ASSERT_GE(gz.size(), 18u) << "header and trailer";
      EXPECT_EQ('\x1f', gz[0]);
      EXPECT_EQ('\x8b', gz[1]);
      for (int readSize : {1, 7, 65536}) {
         if (size > 70000 && readSize == 1) continue;  // bounded work
         EXPECT_EQ(text, Inflate(gz, readSize)) << size << " bytes read " << readSize << " at a time";
      }
   }
}

TEST(GzipFileTest, ReadsWhatZlibWritesAndMembersInARowAsOne) {
   // A stream made by zlib itself, not by our writer.
   std::string text = Text(5000);
   z_stream z{};
   ASSERT_EQ(Z_OK, deflateInit2(&z, 9, Z_DEFLATED, 16 + MAX_WBITS, 8, Z_DEFAULT_STRATEGY));
   std::string out(compressBound(text.size()) + 64, '\0');
   z.next_in = reinterpret_cast<Bytef*>(text.data());
   z.avail_in = static_cast<uInt>(text.size());
   z.next_out = reinterpret_cast<Bytef*>(out.data());
   z.avail_out = static_cast<uInt>(out.size());
   ASSERT_EQ(Z_STREAM_END, deflate(&z, Z_FINISH));
   out.resize(z.total_out);
   deflateEnd(&z);
   EXPECT_EQ(text, Inflate(out, 512));
   EXPECT_EQ(text + "tail", Inflate(out + Deflate("tail"), 512));
}

TEST(GzipFileTest, DamagedOrCutInputRaisesZlibsCondition) {
   std::string gz = Deflate(Text(20000));
   auto failure = [](const std::string& bytes) -> std::string {
      try {
         Inflate(bytes, 1024);
      } catch (const FileIOException& e) {
         return e.GetMessage();
      }
      return "no exception";
   };
   EXPECT_NE("no exception", failure("not gzip at all"));
   EXPECT_NE("no exception", failure(gz.substr(0, gz.size() / 2))) << "cut in the middle";
   std::string flipped = gz;
   flipped[gz.size() / 2] ^= 0x55;
   EXPECT_NE("no exception", failure(flipped));
}

TEST(GzipFileTest, UseAfterCloseAndNullEndsAreRefused) {
   Ref<Reader> reader;
   EXPECT_THROW(CreateGzippedFileReader(nullptr, "x", reader), InvalidArgumentException);
   Ref<Writer> writer;
   EXPECT_THROW(CreateGzippedFileWriter(nullptr, "x", writer), InvalidArgumentException);
   Ref<StringWriter> target;
   CreateStringWriter(target);
   CreateGzippedFileWriter(target.Get(), "x", writer);
   writer->Close();
   EXPECT_THROW(writer->Write("a", 1), InvalidStateException);
}

}  // namespace
}  // namespace Pelmora
