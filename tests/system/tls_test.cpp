#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "pelmora/system.h"
#include "src/core/report.h"
#include "src/system/tls.h"

namespace Pelmora::System {
namespace {

// Collects what the library reports instead of writing it to standard error.
class CapturingSink : public Internal::ReportSink {
public:
   CapturingSink() { Internal::SetReportSink(this); }
   ~CapturingSink() { Internal::SetReportSink(nullptr); }
   bool IsLevelEnabled(int) override { return true; }
   void Log(int level, const std::string& text) override { lines.push_back({level, text}); }
   void LogMemoryBuffer(int, const std::string&, bool) override {}
   void Flush() override {}

   std::vector<std::pair<int, std::string>> lines;
};

class Counted : public ObjectImpl {
public:
   explicit Counted(int* alive) : _alive(alive) { ++*_alive; }
   ~Counted() override { --*_alive; }

private:
   int* _alive;
};

TEST(TlsKeyTableTest, KeysPackVersionAboveIndex) {
   TlsKey key = TlsKeyTable::MakeKey(3, 5);
   EXPECT_EQ((3u << 17) | 5u, key);
   EXPECT_EQ(5u, TlsKeyTable::GetIndex(key));
   EXPECT_EQ(3u, TlsKeyTable::GetVersion(key));
   EXPECT_TRUE(TlsKeyTable::IsKey(key));
   EXPECT_FALSE(TlsKeyTable::IsKey(TlsKeyTable::MakeKey(0, 5)));
}

TEST(TlsKeyTableTest, ReleasedIndexesAreReusedNewestFirstWithNewVersions) {
   TlsKeyTable table;
   TlsKey a = table.Reserve();
   TlsKey b = table.Reserve();
   TlsKey c = table.Reserve();
   EXPECT_EQ(0u, TlsKeyTable::GetIndex(a));
   EXPECT_EQ(1u, TlsKeyTable::GetIndex(b));
   EXPECT_EQ(2u, TlsKeyTable::GetIndex(c));
   table.Release(a);
   table.Release(c);
   TlsKey d = table.Reserve();
   TlsKey e = table.Reserve();
   TlsKey f = table.Reserve();
   EXPECT_EQ(2u, TlsKeyTable::GetIndex(d));
   EXPECT_EQ(0u, TlsKeyTable::GetIndex(e));
   EXPECT_EQ(3u, TlsKeyTable::GetIndex(f));
   EXPECT_NE(c, d);
   EXPECT_NE(a, e);
}

TEST(TlsKeyTableTest, TheVersionNeverWrapsToZero) {
   TlsKeyTable table;
   uint32_t previous = 0;
   for (int i = 0; i < 0x8001; ++i) {
      TlsKey key = table.Reserve();
      ASSERT_TRUE(TlsKeyTable::IsKey(key)) << i;
      ASSERT_EQ(0u, TlsKeyTable::GetIndex(key));
      ASSERT_NE(previous, TlsKeyTable::GetVersion(key));
      previous = TlsKeyTable::GetVersion(key);
      table.Release(key);
   }
   // 0x7FFF versions were used; the next one skips 0 and starts over at 1.
   EXPECT_EQ(2u, previous);
}

TEST(TlsKeyTableDeathTest, BadKeysPanic) {
   TlsKeyTable table;
   TlsKey key = table.Reserve();
   EXPECT_DEATH(
       table.Release(key + 1),
       "Assert Failed: \"key == \\(TlsKey\\)_keys\\[index\\]\" @ src/system/tls.cpp:[0-9]+");
   EXPECT_DEATH(table.Release(TlsKeyTable::MakeKey(1, 7)),
                "\"key == \\(TlsKey\\)_keys\\[index\\]\"");
   EXPECT_DEATH(
       {
          table.Release(key);
          table.Release(key);
       },
       "\"key == \\(TlsKey\\)_keys\\[index\\]\"");
   EXPECT_DEATH(TlsKeyTable::MakeKey(1, TlsKeyTable::INVALID_INDEX),
                "\"index <= MAX_INDEX\" @ src/system/tls.cpp");
   EXPECT_DEATH(ReleaseTlsKey(0), "\"key == \\(TlsKey\\)_keys\\[index\\]\"");
}

TEST(TlsKeyTableDeathTest, AFullTablePanics) {
   EXPECT_DEATH(
       {
          TlsKeyTable table;
          for (uint32_t i = 0; i < TlsKeyTable::MAX_INDEX; ++i) table.Reserve();
          table.Reserve();
       },
       "\"_keys.size\\(\\) < MAX_INDEX\" @ src/system/tls.cpp");
}

TEST(TlsObjectsTest, SetGetAndClearReleaseTheObjects) {
   int alive = 0;
   TlsKeyTable table;
   TlsKey a = table.Reserve();
   TlsKey b = table.Reserve();
   {
      TlsObjects slots;
      EXPECT_EQ(nullptr, slots.Get(b));
      Ref<Counted> first = new Counted(&alive);
      slots.Set(b, first.Get());
      EXPECT_EQ(first.Get(), slots.Get(b));
      EXPECT_EQ(nullptr, slots.Get(a));
      slots.Set(b, new Counted(&alive));
      first.Reset();
      EXPECT_EQ(1, alive);
      slots.Set(b, nullptr);
      EXPECT_EQ(0, alive);
      slots.Set(a, new Counted(&alive));
      slots.Set(b, new Counted(&alive));
      slots.Clear();
      EXPECT_EQ(0, alive);
      EXPECT_EQ(nullptr, slots.Get(a));
      slots.Set(a, new Counted(&alive));
   }
   EXPECT_EQ(0, alive);
}

TEST(TlsObjectsTest, AnObjectLeftUnderAReleasedKeyIsReportedAsLeakedAndReplaced) {
   int alive = 0;
   TlsKeyTable table;
   TlsObjects slots;
   TlsKey old = table.Reserve();
   Counted* stale = new Counted(&alive);
   slots.Set(old, stale);
   std::string staleText = stale->ToString();
   table.Release(old);
   TlsKey reused = table.Reserve();
   ASSERT_EQ(TlsKeyTable::GetIndex(old), TlsKeyTable::GetIndex(reused));

   CapturingSink sink;
   slots.Set(reused, new Counted(&alive));
   ASSERT_EQ(1u, sink.lines.size());
   EXPECT_EQ(Internal::kReportErrorLevel, sink.lines[0].first);
   EXPECT_EQ(
       "Found leaked TLS object at index 0. Expected version=2, found version=1, "
       "found object=" +
           staleText,
       sink.lines[0].second);
   EXPECT_EQ(1, alive);
   slots.Clear();
}

TEST(TlsObjectsDeathTest, ReadingAnObjectLeftUnderAReleasedKeyEndsTheProcess) {
   int alive = 0;
   TlsKeyTable table;
   TlsObjects slots;
   TlsKey old = table.Reserve();
   Ref<Counted> stale = new Counted(&alive);
   slots.Set(old, stale.Get());
   table.Release(old);
   TlsKey reused = table.Reserve();
   EXPECT_DEATH(slots.Get(reused),
                "Found unexpected TLS object at index 0. Expected version=2, found version=1, "
                "found object=\\[[^]]*Counted[^]]*\\]\n\n\nPanic: Not Reached: @ "
                "src/system/tls.cpp");
   EXPECT_DEATH(slots.Set(TlsKeyTable::MakeKey(0, 1), stale.Get()),
                "\"TlsKeyTable::IsKey\\(key\\)\"");
   slots.Clear();
}

TEST(TlsObjectsTest, AnObjectReleasedByClearMayStoreAnother) {
   static TlsKeyTable table;
   static TlsKey key = table.Reserve();
   class Reinstalling : public ObjectImpl {
   public:
      Reinstalling(TlsObjects* slots, int* alive) : _slots(slots), _alive(alive) {}
      ~Reinstalling() override { _slots->Set(key, new Counted(_alive)); }

   private:
      TlsObjects* _slots;
      int* _alive;
   };
   int alive = 0;
   TlsObjects slots;
   slots.Set(key, new Reinstalling(&slots, &alive));
   slots.Clear();
   EXPECT_EQ(0, alive);
   EXPECT_EQ(nullptr, slots.Get(key));
}

}  // namespace
}  // namespace Pelmora::System
