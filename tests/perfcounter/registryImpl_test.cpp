#include <atomic>
#include <chrono>
#include <thread>

#include "tests/perfcounter/fixture.h"
#include "tests/support/logCapture.h"
#include "tests/support/watchdog.h"

namespace Pelmora::PerfCounter::Testing {
namespace {

using testing::ElementsAre;

using RegistryTest = RegistryFixture;

TEST_F(RegistryTest, MalformedAndDuplicateNamesRefuseTheWholeBatch) {
   for (const char* name : {"a/b", "/a/", "/a//b", "/", ""}) {
      try {
         Add({"/ok/first", name});
         ADD_FAILURE() << "accepted " << name;
      } catch (const InvalidArgumentException& e) {
         EXPECT_EQ(std::string("Invalid argument : ") + name, e.what());
      }
   }
   Pelmora::TestSupport::ScopedLogCapture log;
   EXPECT_THROW(Add({"/x/y", "/a/b", "/a/b"}), AlreadyExistsException);
   EXPECT_EQ(0, registry->GetCounterCount());
   Add({"/a/b"});
   try {
      Add({"/a/c", "/a/b"});
      ADD_FAILURE() << "accepted";
   } catch (const AlreadyExistsException& e) {
      EXPECT_EQ(std::string("Already exists: /a/b"), e.what());
   }
   EXPECT_THAT(All(), ElementsAre("/a/b = 0"));
   EXPECT_THAT(log.Lines(), ElementsAre("8 ValidateNewCounters: Counter /a/b added twice.",
                                        "8 ValidateNewCounters: Counter /a/b exists."));
}

TEST_F(RegistryTest, UnregisterPrunesTheTreeAndFreesTheName) {
   Ref<RegistryItem> first = Add({"/p/one", "/p/two"});
   Add({"/p/three/x"}, 10);
   Add({"/p/three"}, 7);  // an inner node may also be a counter
   auto children = [&](const char* path, std::vector<std::string> out = {}) {
      return registry->EnumeratePath(path, out), out;
   };
   EXPECT_THAT(children("/p"), ElementsAre("one", "three", "two"));
   first->Unregister();
   EXPECT_FALSE(first->IsRegistered());
   first->Unregister();  // harmless
   EXPECT_EQ(2, registry->GetCounterCount());
   EXPECT_THAT(children("/p"), ElementsAre("three"));
   EXPECT_THAT(children("/"), ElementsAre("p"));
   EXPECT_TRUE(children("/nothing/here").empty());
   Add({"/p/one"}, 5);
   EXPECT_THAT(All(), ElementsAre("/p/one = 5", "/p/three = 7", "/p/three/x = 10"));
}

class FixedPublisher : public virtual Publisher, public ObjectImpl {
public:
   void GetValue(Metadata*, Value& out) override { out.Set(value); }
   long long value = 0;
};

TEST_F(RegistryTest, ASinglePublisherIsAskedPerCounter) {
   Ref<FixedPublisher> publisher = new FixedPublisher();
   Ref<RegistryItem> item;
   Ref<Metadata> metadata = new Metadata("/single", Metadata::TYPE_COUNTER);
   registry->Register(metadata.Get(), publisher.Get(), item);
   items.push_back(item);
   publisher->value = 43;
   EXPECT_THAT(All(), ElementsAre("/single = 43"));
   EXPECT_THROW(registry->Register(nullptr, publisher.Get(), item), InvalidArgumentException);
}

TEST_F(RegistryTest, ToStringShowsPublishersTreeAndQueriesInOrder) {
   Add({"/s/a"});
   std::vector<std::string> names = {"/s/a"};
   Ref<Query> query;
   registry->CreateNamesQuery(names, query);
   std::string text = registry->ToString();
   size_t at = 0;
   for (const char* part : {"PerfCounter::Registry", " Publisher = { ", " CounterTree = { ",
                            "/s/a => ", " Queries = { ", "names={ /s/a }"}) {
      at = text.find(part, at);
      ASSERT_NE(std::string::npos, at) << part << " in " << text;
   }
   EXPECT_EQ(0u, text.find("PerfCounter::Registry"));
}

TEST(RegistryDestructionTest, LeftoverQueriesAndCountersAreReported) {
   Pelmora::TestSupport::ScopedLogCapture log;
   Ref<Query> query;
   {
      Ref<Registry> registry;
      CreateCounterRegistry(registry);
      AddGroup(registry.Get(), {"/left/a", "/left/b"});
      registry->CreateRegexQuery("left", true, query);
   }
   EXPECT_THAT(log.Lines(),
               ElementsAre("8 Destruction: Queries are still registered -- 1 queries.",
                           "8 Destruction: Counters are still registered -- 2 counters."));
   query.Reset();  // detached: dropping it touches no registry
}

// Unregistering holds the registry it calls: when another thread drops the last other
// reference meanwhile, the registry lives until the unregistration is done.
TEST(RegistryDestructionTest, UnregisteringHoldsAPrivateRegistryUntilDone) {
   Pelmora::TestSupport::ScopedLogCapture log;
   Ref<Registry> registry;
   CreateCounterRegistry(registry);
   Ref<RegistryItem> item = AddGroup(registry.Get(), {"/going/a"});
   registry->WriteLock();  // the unregistration waits here, with the registry in hand
   std::thread unregistering([&] { item->Unregister(); });
   const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
   while (registry->GetRefCount() < 2 && std::chrono::steady_clock::now() < deadline)
      std::this_thread::yield();
   EXPECT_EQ(2, registry->GetRefCount()) << "the unregistration does not hold the registry";
   registry->Unlock();
   registry.Reset();
   Pelmora::Testing::Join(unregistering, "the unregistration");
   EXPECT_FALSE(item->IsRegistered());
   EXPECT_THAT(log.Lines(), testing::IsEmpty());  // it was empty when it went
}

// A query and its registry dropped at once from two threads: neither may reach the
// other after it is freed (caught by the address and thread sanitizers).
TEST(RegistryDestructionTest, AQueryAndItsRegistryDroppedTogetherDoNotRace) {
   Pelmora::TestSupport::ScopedLogCapture log;
   for (int round = 0; round < 300; ++round) {
      Ref<Registry> registry;
      CreateCounterRegistry(registry);
      Ref<Query> query;
      registry->CreateRegexQuery("x", true, query);
      std::atomic<int> ready{0};
      auto dropWhenBothReady = [&ready](auto& ref) {
         ready.fetch_add(1);
         while (ready.load() < 2) {
         }
         ref.Reset();
      };
      std::thread dropsQuery([&] { dropWhenBothReady(query); });
      dropWhenBothReady(registry);
      Pelmora::Testing::Join(dropsQuery, "dropping the query");
   }
}

using RegistryDeathTest = RegistryFixture;

TEST_F(RegistryDeathTest, RegistrationUnderTheCallersReadLockPanics) {
   EXPECT_DEATH(
       {
          registry->ReadLock();
          AddGroup(registry.Get(), {"/r"});
       },
       "Assert Failed:");
}

}  // namespace
}  // namespace Pelmora::PerfCounter::Testing
