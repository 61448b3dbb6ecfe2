#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "src/xml/nodeArena.h"
#include "tests/xml/nodeBuilders.h"

namespace Pelmora::Xml {
namespace {

// A large arena takes its blocks from the system rather than the heap: every size it is
// asked for, small or larger than one such block, must get memory of its own that stays
// until the last node goes.
TEST(NodeArenaTest, ALargeArenaHandsOutSeparateMemoryOfEverySize) {
   auto* arena = new NodeArena();
   std::vector<unsigned char*> nodes;
   for (size_t taken = 0; taken < 8 * 1024 * 1024; taken += 104) {
      auto* node = static_cast<unsigned char*>(arena->Allocate(104));
      std::memset(node, static_cast<int>(nodes.size() % 251), 104);
      nodes.push_back(node);
   }
   const size_t kHuge = 3 * 1024 * 1024;
   auto* huge = static_cast<unsigned char*>(arena->AllocateRaw(kHuge));
   std::memset(huge, 0xa5, kHuge);
   auto* after = static_cast<unsigned char*>(arena->Allocate(104));
   std::memset(after, 0x5a, 104);
   arena->ReleaseCreator();

   for (size_t i = 0; i < nodes.size(); ++i) {
      unsigned char expected = static_cast<unsigned char>(i % 251);
      ASSERT_TRUE(nodes[i][0] == expected && nodes[i][103] == expected) << i;
   }
   EXPECT_EQ(0xa5, huge[0]);
   EXPECT_EQ(0xa5, huge[kHuge - 1]);
   EXPECT_EQ(0x5a, after[103]);
   arena->Release(nodes.size() + 1);
}

// The node memory of a large parsed document stays while any of its nodes is held.
TEST(NodeArenaTest, ANodeHeldFromALargeDocumentOutlivesIt) {
   std::string text = "<r>";
   for (int i = 0; text.size() < 4 * 1024 * 1024; ++i)
      text += "<i n='" + std::to_string(i) + "'>item " + std::to_string(i) + "</i>\n";
   text += "<last kind='end'>the last text</last></r>";
   Ref<ElementNode> last;
   {
      Ref<Document> document = Testing::Parse(text);
      last = dynamic_cast<ElementNode*>(document->GetRoot()->GetLastChild());
      // Another large document in between must not take over the memory.
      Testing::Parse(text);
   }
   EXPECT_EQ(nullptr, last->GetParent());
   EXPECT_EQ("<last kind=\"end\">the last text</last>", Testing::Write(last.Get()));
}

}  // namespace
}  // namespace Pelmora::Xml
