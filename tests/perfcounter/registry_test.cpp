#include <gtest/gtest.h>
#include <gmock/gmock.h>

#include "pelmora/exception/exceptions.h"
#include "pelmora/perfCounter.h"
#include "tests/support/logCapture.h"

namespace Pelmora::PerfCounter {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;

class FixedPublisher : public virtual Publisher, public ObjectImpl {
public:
   explicit FixedPublisher(long long value) : value(value) {}
   void GetValue(Metadata*, Value& out) override { out.Set(value); }
   long long value;
};

// Each counter's value is its position in the group plus a base.
class IndexPublisher : public virtual GroupPublisher, public ObjectImpl {
public:
   explicit IndexPublisher(long long base = 0) : _base(base) {}
   void CollectValues(RefVector<Metadata>& metadata, std::vector<Value>& values) override {
      for (size_t i = 0; i < metadata.size(); ++i) values.emplace_back(_base + static_cast<long long>(i));
   }

private:
   long long _base;
};

RefVector<Metadata> Names(std::initializer_list<const char*> names) {
   RefVector<Metadata> metadata;
   for (const char* name : names) metadata.push_back(new Metadata(name, Metadata::TYPE_GAUGE));
   return metadata;
}

std::vector<std::string> CollectedNames(Registry* registry) {
   QueryResults results;
   registry->CollectAll(results);
   std::vector<std::string> names;
   for (const QueryResult& r : results) names.push_back(r.ToString());
   return names;
}

class RegistryTest : public testing::Test {
protected:
   void SetUp() override { CreateCounterRegistry(registry); }
   void TearDown() override {
      for (auto& item : items) item->Unregister();
   }
   Ref<RegistryItem> RegisterGroup(std::initializer_list<const char*> names, long long base = 0) {
      RefVector<Metadata> metadata = Names(names);
      Ref<GroupPublisher> publisher = new IndexPublisher(base);
      Ref<RegistryItem> item;
      registry->RegisterGroup(metadata, publisher.Get(), item);
      items.push_back(item);
      return item;
   }

   Ref<Registry> registry;
   RefVector<RegistryItem> items;
};

TEST_F(RegistryTest, MalformedNamesAreRefusedWithTheName) {
   for (const char* name : {"a/b", "/a/", "/a//b", "/", ""}) {
      SCOPED_TRACE(name);
      try {
         RegisterGroup({"/ok/first", name});
         FAIL() << "accepted";
      } catch (const InvalidArgumentException& e) {
         EXPECT_EQ(std::string("Invalid argument : ") + name, e.what());
      }
   }
   EXPECT_EQ(0, registry->GetCounterCount());
}

TEST_F(RegistryTest, DuplicatesRefuseTheWholeBatchAndAreLogged) {
   Pelmora::TestSupport::ScopedLogCapture log;
   EXPECT_THROW(RegisterGroup({"/x/y", "/a/b", "/a/b"}), AlreadyExistsException);
   EXPECT_EQ(0, registry->GetCounterCount());
   RegisterGroup({"/a/b"});
   try {
      RegisterGroup({"/a/c", "/a/b"});
      FAIL() << "accepted";
   } catch (const AlreadyExistsException& e) {
      EXPECT_EQ(std::string("Already exists: /a/b"), e.what());
   }
   EXPECT_THAT(CollectedNames(registry.Get()), ElementsAre("/a/b = 0"));
   EXPECT_THAT(log.Lines(), ElementsAre("8 ValidateNewCounters: Counter /a/b added twice.",
                                        "8 ValidateNewCounters: Counter /a/b exists."));
}

TEST_F(RegistryTest, AnInnerNodeMayAlsoBeACounter) {
   RegisterGroup({"/a/b/c"});
   RegisterGroup({"/a/b"}, 7);
   EXPECT_THAT(CollectedNames(registry.Get()), ElementsAre("/a/b = 7", "/a/b/c = 0"));
}

TEST_F(RegistryTest, UnregisterRemovesTheGroupAndPrunesTheTree) {
   Ref<RegistryItem> first = RegisterGroup({"/p/one", "/p/two"});
   RegisterGroup({"/p/three/x"}, 10);
   std::vector<std::string> children;
   registry->EnumeratePath("/p", children);
   EXPECT_THAT(children, ElementsAre("one", "three", "two"));

   first->Unregister();
   EXPECT_FALSE(first->IsRegistered());
   first->Unregister();  // harmless
   EXPECT_EQ(1, registry->GetCounterCount());
   children.clear();
   registry->EnumeratePath("/p", children);
   EXPECT_THAT(children, ElementsAre("three"));
   children.clear();
   registry->EnumeratePath("/", children);
   EXPECT_THAT(children, ElementsAre("p"));
   children.clear();
   registry->EnumeratePath("/nothing/here", children);
   EXPECT_TRUE(children.empty());

   // The name is free again.
   RegisterGroup({"/p/one"}, 5);
   EXPECT_THAT(CollectedNames(registry.Get()), ElementsAre("/p/one = 5", "/p/three/x = 10"));
}

TEST_F(RegistryTest, ASinglePublisherIsAskedPerCounter) {
   Ref<FixedPublisher> publisher = new FixedPublisher(42);
   Ref<RegistryItem> item;
   Ref<Metadata> metadata = new Metadata("/single", Metadata::TYPE_COUNTER);
   registry->Register(metadata.Get(), publisher.Get(), item);
   items.push_back(item);
   publisher->value = 43;
   EXPECT_THAT(CollectedNames(registry.Get()), ElementsAre("/single = 43"));
   EXPECT_THROW(registry->Register(nullptr, publisher.Get(), item), InvalidArgumentException);
}

TEST_F(RegistryTest, ToStringShowsPublishersTreeAndQueries) {
   RegisterGroup({"/s/a"});
   std::vector<std::string> names = {"/s/a"};
   Ref<Query> query;
   registry->CreateNamesQuery(names, query);
   std::string text = registry->ToString();
   EXPECT_EQ(0u, text.find("PerfCounter::Registry"));
   EXPECT_THAT(text, HasSubstr(" Publisher = { "));
   EXPECT_THAT(text, HasSubstr(" CounterTree = { "));
   EXPECT_THAT(text, HasSubstr("/s/a => "));
   EXPECT_THAT(text, HasSubstr(" Queries = { "));
   EXPECT_THAT(text, HasSubstr("names={ /s/a }"));
   EXPECT_LT(text.find("Publisher"), text.find("CounterTree"));
   EXPECT_LT(text.find("CounterTree"), text.find("Queries"));
   EXPECT_THAT(Ref<Metadata>(new Metadata("/m", Metadata::TYPE_GAUGE))->ToString(),
               HasSubstr(" _name=/m"));
}

TEST(RegistryDestructionTest, LeftoverQueriesAndCountersAreReported) {
   Pelmora::TestSupport::ScopedLogCapture log;
   Ref<Query> query;
   {
      Ref<Registry> registry;
      CreateCounterRegistry(registry);
      RefVector<Metadata> metadata = Names({"/left/a", "/left/b"});
      Ref<GroupPublisher> publisher = new IndexPublisher();
      Ref<RegistryItem> item;
      registry->RegisterGroup(metadata, publisher.Get(), item);
      registry->CreateRegexQuery("left", true, query);
   }
   EXPECT_THAT(log.Lines(),
               ElementsAre("8 Destruction: Queries are still registered -- 1 queries.",
                           "8 Destruction: Counters are still registered -- 2 counters."));
   query.Reset();  // detached: dropping it touches no registry
}

TEST(RegistryDeathTest, RegistrationUnderTheCallersReadLockPanics) {
   Ref<Registry> registry;
   CreateCounterRegistry(registry);
   RefVector<Metadata> metadata = Names({"/r"});
   Ref<GroupPublisher> publisher = new IndexPublisher();
   EXPECT_DEATH(
       {
          Ref<RegistryItem> item;
          registry->ReadLock();
          registry->RegisterGroup(metadata, publisher.Get(), item);
       },
       "Assert Failed:");
}

TEST(CounterRegistryTest, TheProcessRegistryIsOneInstance) {
   EXPECT_EQ(GetCounterRegistry(), GetCounterRegistry());
   EXPECT_NE(nullptr, GetCounterRegistry());
}

}  // namespace
}  // namespace Pelmora::PerfCounter
