#pragma once
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <vector>

#include "pelmora/exception/exceptions.h"
#include "pelmora/io/writers.h"
#include "pelmora/perfCounter.h"

namespace Pelmora::PerfCounter::Testing {

// Counter i of a group reads base + i; counts its calls.
class IndexPublisher : public virtual GroupPublisher, public ObjectImpl {
public:
   explicit IndexPublisher(long long base) : _base(base) {}
   void CollectValues(RefVector<Metadata>& metadata, std::vector<Value>& values) override {
      ++calls;
      for (size_t i = 0; i < metadata.size(); ++i) values.emplace_back(_base + (long long)i);
   }
   std::atomic<int> calls{0};

private:
   long long _base;
};

inline std::vector<std::string> Texts(const QueryResults& results) {
   std::vector<std::string> texts;
   for (const QueryResult& r : results) texts.push_back(r.ToString());
   return texts;
}

inline Ref<RegistryItem> AddGroup(Registry* registry, const std::vector<std::string>& names,
                                  long long base = 0, Metadata::Type type = Metadata::TYPE_GAUGE,
                                  Ref<IndexPublisher>* out = nullptr) {
   RefVector<Metadata> metadata;
   for (const auto& name : names) metadata.push_back(new Metadata(name, type));
   Ref<IndexPublisher> publisher = new IndexPublisher(base);
   Ref<RegistryItem> item;
   registry->RegisterGroup(metadata, publisher.Get(), item);
   if (out) *out = publisher;
   return item;
}

// The builder's text, one line per key.
inline std::string Serialized(const LwStatsBuilder& builder) {
   Ref<StringWriter> writer;
   CreateStringWriter(writer);
   builder.Serialize(writer.Get());
   return writer->GetString();
}

// A private registry whose groups added through Add are unregistered after the test.
class RegistryFixture : public testing::Test {
protected:
   void SetUp() override { CreateCounterRegistry(registry); }
   void TearDown() override {
      for (auto& item : items) item->Unregister();
   }
   template <typename... Args>
   Ref<RegistryItem> Add(const std::vector<std::string>& names, Args... args) {
      items.push_back(AddGroup(registry.Get(), names, args...));
      return items.back();
   }
   std::vector<std::string> All() {
      QueryResults results;
      registry->CollectAll(results);
      return Texts(results);
   }
   static std::vector<std::string> Run(Query* query) {
      QueryResults results;
      query->Execute(results);
      return Texts(results);
   }
   std::vector<std::string> Match(const std::string& pattern) {
      Ref<Query> query;
      registry->CreateRegexQuery(pattern, true, query);
      return Run(query.Get());
   }

   Ref<Registry> registry;
   RefVector<RegistryItem> items;
};

}  // namespace Pelmora::PerfCounter::Testing
