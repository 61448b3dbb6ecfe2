#include <gtest/gtest.h>

#include <string>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/writers.h"

namespace Pelmora {
namespace {

class RecordingWriter : public virtual Writer, public ObjectImpl {
public:
   void Write(const char* data, int length) override { text.append(data, length); }
   void Flush() override { ++flushes; }
   void Close() override { ++closes; }

   std::string text;
   int flushes = 0;
   int closes = 0;
};

TEST(DoubleWriterTest, WritesFlushesAndClosesBothTargets) {
   Ref<RecordingWriter> first = new RecordingWriter();
   Ref<RecordingWriter> second = new RecordingWriter();
   Ref<Writer> writer;
   EXPECT_THROW(CreateDoubleWriter(nullptr, second.Get(), writer), InvalidArgumentException);
   EXPECT_THROW(CreateDoubleWriter(first.Get(), nullptr, writer), InvalidArgumentException);
   CreateDoubleWriter(first.Get(), second.Get(), writer);

   writer->Write("ab", 2);
   writer->Write("cde", 3);
   EXPECT_EQ("abcde", first->text);
   EXPECT_EQ("abcde", second->text);
   writer->Flush();
   writer->Close();
   for (RecordingWriter* target : {first.Get(), second.Get()}) {
      EXPECT_EQ(1, target->flushes);
      EXPECT_EQ(1, target->closes);
   }
}

}  // namespace
}  // namespace Pelmora
