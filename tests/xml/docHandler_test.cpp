// The document handler: the memory a large text leaves behind once its document is gone.

#include <gtest/gtest.h>
#include <malloc.h>

#include <string>

#include "pelmora/xml.h"

namespace Pelmora::Xml {
namespace {

// A pooled parser lives as long as the process: once a document is gone, the memory of
// its text must be too, not kept by the handler for the next document.
TEST(DocHandlerTest, ALargeTextLeavesNoMemoryBehindOnceItsDocumentIsGone) {
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
   GTEST_SKIP() << "the sanitizer's allocator does not report through mallinfo2";
#endif
   Ref<XMLHandler> handler;
   CreateXMLDocumentHandler(handler);
   Ref<XMLParser> parser;
   CreateXMLParser(handler.Get(), parser);
   auto inUse = [] {
      struct mallinfo2 info = mallinfo2();
      return info.uordblks + info.hblkhd;
   };
   size_t before = inUse();
   {
      Ref<Object> result;
      parser->Parse("<r>" + std::string(size_t(64) << 20, 'x') + "</r>", false, result);
   }
   EXPECT_LT(inUse(), before + (size_t(8) << 20));
}

}  // namespace
}  // namespace Pelmora::Xml
