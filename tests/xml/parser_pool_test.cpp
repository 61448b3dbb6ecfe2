#include <gtest/gtest.h>

#include <atomic>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/xml.h"

namespace Pelmora::Xml {
namespace {

TEST(ParserPoolTest, ADroppedLeaseHandsItsParserBack) {
   Ref<XMLParserPool> pool;
   CreateXMLParserPool(pool);
   Ref<XMLParserPool::ParserLease> first, second;
   pool->GetParserLease(first);
   pool->GetParserLease(second);
   XMLParser* firstParser = first->GetParser();
   ASSERT_NE(nullptr, firstParser);
   EXPECT_NE(firstParser, second->GetParser());

   Ref<XMLParser> kept = firstParser;  // to compare after the lease is gone
   first.Reset();
   pool->GetParserLease(first);
   EXPECT_EQ(kept.Get(), first->GetParser());

   // A leased parser carries a standard handler: it builds documents.
   Ref<Object> result;
   first->GetParser()->Parse("<a b='c'/>", true, result);
   EXPECT_EQ("a", result.Cast<Document>()->GetRoot()->GetTag());

   // Leases keep their pool alive.
   XMLParser* secondParser = second->GetParser();
   pool.Reset();
   second.Reset();
   first->GetParser()->Parse("<again/>", result);
   first.Reset();
   EXPECT_NE(nullptr, secondParser);
}

TEST(ParserPoolTest, TheProcessPoolServesManyThreadsAtOnce) {
   XMLParserPool* pool = GetXmlParserPool();
   ASSERT_EQ(pool, GetXmlParserPool());
   constexpr int kThreads = 8;
   constexpr int kParses = 150;
   std::atomic<int> failures{0};
   std::vector<std::thread> threads;
   std::vector<std::set<XMLParser*>> seen(kThreads);
   for (int t = 0; t < kThreads; ++t) {
      threads.emplace_back([&, t] {
         for (int i = 0; i < kParses; ++i) {
            Ref<XMLParserPool::ParserLease> lease;
            pool->GetParserLease(lease);
            seen[t].insert(lease->GetParser());
            std::string value = std::to_string(t * kParses + i);
            Ref<Object> result;
            lease->GetParser()->Parse("<r><v>" + value + "</v></r>", true, result);
            std::string read;
            if (!EvaluateSimplePath(result.Cast<Document>().Get(), "r/v", read) || read != value)
               ++failures;
         }
      });
   }
   for (std::thread& thread : threads) thread.join();
   EXPECT_EQ(0, failures.load());
   std::set<XMLParser*> all;
   for (const auto& parsers : seen) all.insert(parsers.begin(), parsers.end());
   // Parsers are reused: never more than the leases out at one time.
   EXPECT_LE(all.size(), static_cast<size_t>(kThreads));
}

TEST(ParserPoolTest, ALeaseMayBeReleasedOnAnotherThread) {
   Ref<XMLParserPool> pool;
   CreateXMLParserPool(pool);
   Ref<XMLParserPool::ParserLease> lease;
   pool->GetParserLease(lease);
   Ref<XMLParser> parser = lease->GetParser();
   Ref<Object> document;
   parser->Parse("<a><b>text</b><c/></a>", true, document);
   // The lease and the document die on another thread while this one parses with another
   // parser.
   std::thread other([lease = std::move(lease), document = std::move(document)]() mutable {
      document.Reset();
      lease.Reset();
   });
   Ref<XMLParserPool::ParserLease> second;
   pool->GetParserLease(second);
   Ref<Object> next;
   XMLParser* secondParser = second->GetParser();
   secondParser->Parse("<d><e/></d>", true, next);
   other.join();
   second.Reset();
   next.Reset();
   // The parser returned last is handed out first.
   Ref<XMLParserPool::ParserLease> again;
   pool->GetParserLease(again);
   EXPECT_EQ(secondParser, again->GetParser());
}

}  // namespace
}  // namespace Pelmora::Xml
