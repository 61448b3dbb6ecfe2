#include <gtest/gtest.h>

#include <atomic>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "pelmora/xml.h"
#include "tests/support/watchdog.h"

namespace Pelmora::Xml {
namespace {

using Lease = Ref<XMLParserPool::ParserLease>;

TEST(ParserPoolTest, TheProcessPoolServesManyThreadsAtOnce) {
   XMLParserPool* pool = GetXmlParserPool();
   ASSERT_EQ(pool, GetXmlParserPool());
   constexpr int kThreads = 8, kParses = 150;
   std::atomic<int> failures{0};
   std::vector<std::set<XMLParser*>> seen(kThreads);
   std::vector<std::thread> threads;
   for (int t = 0; t < kThreads; ++t) {
      threads.emplace_back([&, t] {
         for (int i = 0; i < kParses; ++i) {
            Lease lease;
            pool->GetParserLease(lease);
            seen[t].insert(lease->GetParser());
            std::string value = std::to_string(t * kParses + i), read;
            Ref<Object> result;
            lease->GetParser()->Parse("<r><v>" + value + "</v></r>", true, result);
            if (!EvaluateSimplePath(result.Cast<Document>().Get(), "r/v", read) || read != value)
               ++failures;
         }
      });
   }
   Pelmora::Testing::JoinAll(threads, "threads to finish");
   EXPECT_EQ(0, failures.load());
   std::set<XMLParser*> all;
   for (const auto& parsers : seen) all.insert(parsers.begin(), parsers.end());
   // Parsers are reused: never more than the leases out at one time.
   EXPECT_LE(all.size(), static_cast<size_t>(kThreads));
}

TEST(ParserPoolTest, ALeaseReleasedOnAnyThreadHandsItsParserBackLastInFirstOut) {
   Ref<XMLParserPool> pool;
   CreateXMLParserPool(pool);
   Lease lease, second, again;
   pool->GetParserLease(lease);
   Ref<Object> document, next;
   lease->GetParser()->Parse("<a><b>text</b><c/></a>", true, document);
   // The lease and its document die on another thread while this one parses with another parser.
   std::thread other([lease = std::move(lease), document = std::move(document)]() mutable {
      document.Reset();
      lease.Reset();
   });
   pool->GetParserLease(second);
   XMLParser* secondParser = second->GetParser();
   secondParser->Parse("<d><e/></d>", true, next);
   Pelmora::Testing::Join(other, "other to finish");
   second.Reset();
   pool->GetParserLease(again);
   EXPECT_EQ(secondParser, again->GetParser());
   pool->GetParserLease(second);
   EXPECT_NE(secondParser, second->GetParser());

   // Leases keep their pool alive.
   pool.Reset();
   second.Reset();
   again->GetParser()->Parse("<again/>", next);
   EXPECT_EQ("again", next.Cast<Document>()->GetRoot()->GetTag());
   again.Reset();
}

}  // namespace
}  // namespace Pelmora::Xml
