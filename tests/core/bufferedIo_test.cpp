#include <gtest/gtest.h>

#include <deque>
#include <string>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/readers.h"
#include "pelmora/io/writers.h"

namespace Pelmora {
namespace {

using Strings = std::vector<std::string>;

// Hands out one chunk per Read (cut to the length asked); an empty chunk is an answer of 0,
// as from a non-blocking source with nothing yet. Then -1.
class ChunkReader : public virtual Reader, public ObjectImpl {
public:
   explicit ChunkReader(std::deque<std::string> chunks) : _chunks(std::move(chunks)) {}
   int Read(char* buffer, int length) override {
      if (_chunks.empty()) return -1;
      int count = static_cast<int>(_chunks.front().copy(buffer, length));
      _chunks.front().erase(0, count);
      if (_chunks.front().empty()) _chunks.pop_front();
      return count;
   }
   void Close() override {}

private:
   std::deque<std::string> _chunks;
};

class RecordingWriter : public virtual Writer, public ObjectImpl {
public:
   void Write(const char* data, int length) override {
      if (failWrites) throw IOException("write refused");
      writes.emplace_back(data, length);
   }
   void Flush() override { ++flushes; }
   void Close() override { ++closes; }

   Strings writes;
   int flushes = 0;
   int closes = 0;
   bool failWrites = false;
};

Strings Lines(Reader* source, int bufferSize) {
   Ref<BufferedReader> reader;
   CreateBufferedReader(source, bufferSize, reader);
   Strings lines;
   std::string line;
   while (reader->ReadLine(&line)) lines.push_back(line);
   EXPECT_EQ("", line);  // the end leaves no stale text behind
   return lines;
}

Strings Lines(const std::string& text, int bufferSize) {
   Ref<StringReader> source;
   CreateStringReader(text.data(), static_cast<int>(text.size()), source);
   return Lines(source.Get(), bufferSize);
}

TEST(BufferedReaderTest, LfCrAndCrLfEachEndOneLineWhateverTheBufferSize) {
   for (int size : {1, 2, 3, 64}) {
      SCOPED_TRACE(size);
      EXPECT_EQ((Strings{"a", "b", "c"}), Lines("a\r\nb\rc\n", size));
      EXPECT_EQ((Strings{"one", "", "", "two"}), Lines("one\n\r\r\ntwo", size));
      EXPECT_EQ(Strings{}, Lines("", size));
   }
   // A CR LF pair split by empty answers of the source.
   Ref<ChunkReader> source = new ChunkReader({"", "a\r", "", "", "\nb", "", "c"});
   EXPECT_EQ((Strings{"a", "bc"}), Lines(source.Get(), 8));
}

TEST(BufferedReaderTest, ReadFillsTheRequestAcrossRechargesUntilTheEnd) {
   Ref<ChunkReader> source = new ChunkReader({"ab\n", "", "cdefgh", "", "ij"});
   Ref<BufferedReader> reader;
   CreateBufferedReader(source.Get(), 3, reader);
   std::string line;
   ASSERT_TRUE(reader->ReadLine(&line));
   char buffer[16] = {};
   EXPECT_EQ(0, reader->Read(buffer, 0));
   EXPECT_EQ(5, reader->Read(buffer, 5));
   EXPECT_EQ("cdefg", std::string(buffer, 5));
   EXPECT_EQ(3, reader->Read(buffer, sizeof(buffer)));  // the end cuts the request short
   EXPECT_EQ("hij", std::string(buffer, 3));
   EXPECT_EQ(-1, reader->Read(buffer, sizeof(buffer)));
   EXPECT_EQ(-1, reader->Read(buffer, 0));
   EXPECT_THROW(reader->Read(buffer, -1), InvalidArgumentException);
   EXPECT_THROW(CreateBufferedReader(source.Get(), 0, reader), InvalidArgumentException);
   EXPECT_THROW(CreateBufferedReader(nullptr, 8, reader), InvalidArgumentException);
}

TEST(BufferedWriterTest, BuffersWhatFitsAndPassesLargePiecesStraightOn) {
   Ref<RecordingWriter> target = new RecordingWriter();
   Ref<BufferedWriter> writer;
   CreateBufferedWriter(8, target.Get(), writer);
   writer->Write("abc", 3);
   writer->Write("def", 3);
   EXPECT_TRUE(target->writes.empty());
   writer->Write("ghi", 3);    // 6 + 3 > 8: the first six go on, these are kept
   writer->Write("jklmn", 5);  // exactly fills the buffer
   EXPECT_EQ(Strings{"abcdef"}, target->writes);
   writer->Write("0123456789", 10);
   EXPECT_EQ((Strings{"abcdef", "ghijklmn", "0123456789"}), target->writes);
   EXPECT_EQ(0, target->flushes);  // a full buffer does not flush the target

   writer->Write("xy", 2);
   writer->Flush();
   writer->Flush();  // nothing buffered: no empty write
   EXPECT_EQ((Strings{"abcdef", "ghijklmn", "0123456789", "xy"}), target->writes);
   EXPECT_EQ(2, target->flushes);
   writer->Write("ABCDEFGH", 8);  // as large as the buffer: still buffered
   EXPECT_EQ(4u, target->writes.size());
   EXPECT_THROW(writer->Write("a", -1), InvalidArgumentException);
   EXPECT_THROW(CreateBufferedWriter(0, target.Get(), writer), InvalidArgumentException);
   EXPECT_THROW(CreateBufferedWriter(8, nullptr, writer), InvalidArgumentException);
}

TEST(BufferedWriterTest, CloseAndDestructionHandOnWhatIsBuffered) {
   Ref<RecordingWriter> target = new RecordingWriter();
   Ref<BufferedWriter> writer;
   CreateBufferedWriter(16, target.Get(), writer);
   writer->Write("closing", 7);
   writer->Close();
   EXPECT_EQ(Strings{"closing"}, target->writes);
   EXPECT_EQ(1, target->closes);

   CreateBufferedWriter(16, target.Get(), writer);
   writer->Write("dropped", 7);
   writer.Reset();
   EXPECT_EQ((Strings{"closing", "dropped"}), target->writes);

   // Bytes a failing target refused stay buffered; the destructor's retry fails quietly.
   CreateBufferedWriter(16, target.Get(), writer);
   writer->Write("lost", 4);
   target->failWrites = true;
   EXPECT_THROW(writer->Flush(), IOException);
   EXPECT_NO_THROW(writer.Reset());
   EXPECT_EQ(1, target->GetRefCount());
}

}  // namespace
}  // namespace Pelmora
