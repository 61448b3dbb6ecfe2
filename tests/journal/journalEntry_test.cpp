// The record layout, checked byte for byte against files built by hand from the layout.

#include <gtest/gtest.h>

#include <cstring>

#include "pelmora/exception/panic.h"
#include "pelmora/io/writers.h"
#include "pelmora/service/journal.h"
#include "tests/support/journalBytes.h"

namespace Pelmora::Service {
namespace {

using namespace Pelmora::TestSupport;

std::string Str(const std::string& s) { return U32(uint32_t(s.size() + 1)) + s + std::string(1, '\0'); }

std::string Bytes(BaseJrnlEntry& entry) {
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   int n = entry.Serialize(writer.Get());
   EXPECT_EQ(n, writer->GetLength());
   return writer->GetString();
}

template <class Entry>
Ref<Entry> Parse(std::string bytes) {
   Ref<Entry> entry = new Entry();
   entry->Deserialize(bytes.data(), static_cast<unsigned>(bytes.size()));
   return entry;
}

std::string HeaderBytes(JrnlHeader& header) {
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   header.Serialize(writer.Get());
   return writer->GetString();
}

const std::string tooSmall = "Buffer is too small to have a full record. Journal might be corrupt";
const std::string unexpected = "Unexpected character found in the header. Perhaps corrupt journal";

std::string Message(const std::function<void()>& f) {
   try {
      f();
   } catch (const JrnlException& e) {
      return e.GetMessage();
   }
   return "no exception";
}

TEST(JournalEntryTest, EveryEntryHasItsCodeAndLayout) {
   JrnlBeginEntry begin;
   EXPECT_EQ(Bytes(begin), U32(1));
   JrnlEndEntry end(true);
   EXPECT_EQ(Bytes(end), U32(2) + std::string(1, '\1'));
   JrnlUndoFormerEntry undo(-7);
   EXPECT_EQ(Bytes(undo), U32(3) + U32(uint32_t(-7)));
   JrnlDirEntry dir(false, "/a/b");
   EXPECT_EQ(Bytes(dir), U32(4) + std::string(1, '\0') + Str("/a/b"));
   JrnlFileEntry file(true, kJrnlFileSymlink, "/f");
   EXPECT_EQ(Bytes(file), U32(5) + std::string(1, '\1') + U32(2) + Str("/f"));
   JrnlIntFieldEntry intField("n", 0x01020304);
   EXPECT_EQ(Bytes(intField), U32(6) + Str("n") + "\x04\x03\x02\x01");
   // The string field comes before the long field, codes 7 then 8.
   JrnlStringFieldEntry stringField("k", "v");
   EXPECT_EQ(Bytes(stringField), U32(7) + Str("k") + Str("v"));
   JrnlLongFieldEntry longField("l", 0x0102030405060708LL);
   EXPECT_EQ(Bytes(longField), U32(8) + Str("l") + "\x08\x07\x06\x05\x04\x03\x02\x01");
}

TEST(JournalEntryTest, EntriesReadBackWhatWasWritten) {
   EXPECT_FALSE(Parse<JrnlEndEntry>(U32(2) + std::string(1, '\0'))->IsCompleted());
   EXPECT_EQ(Parse<JrnlUndoFormerEntry>(U32(3) + U32(42))->GetBeginRecord(), 42);
   auto dir = Parse<JrnlDirEntry>(U32(4) + std::string(1, '\1') + Str("/x y"));
   EXPECT_TRUE(dir->IsCreation());
   EXPECT_EQ(dir->GetPath(), "/x y");
   auto file = Parse<JrnlFileEntry>(U32(5) + std::string(1, '\0') + U32(1) + Str("/p"));
   EXPECT_FALSE(file->IsCreation());
   EXPECT_EQ(file->GetFileType(), kJrnlFileRegular);
   EXPECT_EQ(file->GetPath(), "/p");
   auto s = Parse<JrnlStringFieldEntry>(U32(7) + Str("name") + Str(""));
   EXPECT_EQ(s->GetName(), "name");
   EXPECT_EQ(s->GetValue(), "");
   EXPECT_EQ(Parse<JrnlLongFieldEntry>(U32(8) + Str("l") + std::string(8, '\xff'))->GetValue(), -1);
   EXPECT_EQ(Parse<JrnlIntFieldEntry>(U32(6) + Str("i") + U32(5))->GetValue(), 5);
}

TEST(JournalEntryTest, MalformedRecordsAreRefused) {
   // A string whose length runs past the record.
   EXPECT_EQ(Message([&] { Parse<JrnlDirEntry>(U32(4) + std::string(1, '\1') + U32(9) + "ab"); }), tooSmall);
   // A string without its zero byte, and one with a zero inside.
   EXPECT_EQ(Message([&] { Parse<JrnlDirEntry>(U32(4) + std::string(1, '\1') + U32(2) + "ab"); }), unexpected);
   EXPECT_EQ(Message([&] { Parse<JrnlDirEntry>(U32(4) + std::string(1, '\1') + U32(3) + std::string("a\0\0", 3)); }),
             unexpected);
   // Bytes left over, a wrong code, a flag that is not a boolean, a missing value.
   EXPECT_EQ(Message([&] { Parse<JrnlBeginEntry>(U32(1) + "x"); }), unexpected);
   EXPECT_EQ(Message([&] { Parse<JrnlBeginEntry>(U32(2)); }), unexpected);
   EXPECT_EQ(Message([&] { Parse<JrnlEndEntry>(U32(2) + "\x02"); }), tooSmall);
   EXPECT_EQ(Message([&] { Parse<JrnlLongFieldEntry>(U32(8) + Str("l") + "1234"); }), tooSmall);
}

TEST(JournalEntryTest, EmptyPathOrNameIsNotSerialized) {
   JrnlDirEntry dir(true, "");
   JrnlFileEntry file(true, kJrnlFileRegular, "");
   JrnlIntFieldEntry field("", 1);
   for (BaseJrnlEntry* entry : std::initializer_list<BaseJrnlEntry*>{&dir, &file, &field})
      EXPECT_EQ(Message([&] { Bytes(*entry); }), "Serializing Invalid Journal Entry");
}

TEST(JournalEntryTest, PrintEntryKeepsOneLine) {
   JrnlFileEntry file(false, kJrnlFileRegular, "/a\nb");
   EXPECT_EQ(file.PrintEntry(), "File remove type 1 \"/a\\x0ab\"");
}

TEST(JournalHeaderTest, LayoutAndLength) {
   JrnlHeader empty(1, 2, 3, "id");
   std::string bytes = HeaderBytes(empty);
   EXPECT_EQ(bytes, U32(1) + U32(2) + U32(3) + U32(0) + U32(3) + std::string("id\0", 3));
   JrnlHeader withData(kJrnlHeaderMagic, kJrnlKindFileOps, 9, "j", std::string("\0d", 2));
   bytes = HeaderBytes(withData);
   EXPECT_EQ(bytes, std::string("JRNL") + U32(1) + U32(9) + U32(2) + std::string("\0d", 2) + U32(2) +
                        std::string("j\0", 2));
   JrnlHeader back;
   back.Deserialize(bytes.data(), static_cast<unsigned>(bytes.size()));
   EXPECT_TRUE(back.CheckIntegrity(kJrnlHeaderMagic, kJrnlKindFileOps));
   EXPECT_FALSE(back.CheckIntegrity(kJrnlHeaderMagic, 2));
   EXPECT_EQ(back.GetData(), std::string("\0d", 2));
   EXPECT_EQ(back.GetId(), "j");
   EXPECT_EQ(back.GetTimeStamp(), 9u);
}

TEST(JournalHeaderTest, MalformedHeadersAreRefused) {
   JrnlHeader header;
   const std::string head = U32(1) + U32(2) + U32(3);
   const std::pair<std::string, std::string> cases[] = {
       {std::string(20, '\0'), tooSmall},
       {head + U32(50) + U32(3) + std::string("id\0", 3), tooSmall},  // data past the end
       {head + U32(0) + U32(3) + std::string("idx", 3), unexpected},   // no zero byte
       {head + U32(0) + U32(3) + std::string("i\0\0", 3), unexpected},
       {head + U32(0) + U32(0) + std::string("\0", 1), unexpected}};  // no id
   for (const auto& [bytes, error] : cases) {
      EXPECT_EQ(Message([&] { header.Deserialize(bytes.data(), unsigned(bytes.size())); }), error)
          << testing::PrintToString(bytes);
   }
   JrnlHeader noId(1, 2, 3, "");
   EXPECT_EQ(Message([&] { HeaderBytes(noId); }), "Serializing Invalid Header");
}

TEST(JournalHeaderDeathTest, NullWriterAndBufferPanic) {
   JrnlHeader header(1, 2, 3, "id");
   EXPECT_DEATH(header.Serialize(nullptr), "writer != __null");
   EXPECT_DEATH(header.Deserialize(nullptr, 0), "buffer && len");
}

}  // namespace
}  // namespace Pelmora::Service
