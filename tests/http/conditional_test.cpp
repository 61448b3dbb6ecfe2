#include "src/http/conditional.h"

#include <gtest/gtest.h>

namespace Pelmora::Http {
namespace {

TEST(ConditionalTest, RangesAreServedOnlyWhenSingleAndInsideTheFile) {
   struct Case {
      const char* field;
      long long size;
      ByteRange::Kind kind;
      long long first, last;
   } cases[] = {
       {"bytes=0-99", 1000, ByteRange::PART, 0, 99},
       {"Bytes = 10 - 19", 1000, ByteRange::PART, 10, 19},
       {"bytes=990-2000", 1000, ByteRange::PART, 990, 999},  // the end is clipped
       {"bytes=500-", 1000, ByteRange::PART, 500, 999},
       {"bytes=-100", 1000, ByteRange::PART, 900, 999},
       {"bytes=-5000", 1000, ByteRange::PART, 0, 999},  // a suffix longer than the file
       {"bytes=1000-", 1000, ByteRange::UNSATISFIABLE, 0, -1},
       {"bytes=-0", 1000, ByteRange::UNSATISFIABLE, 0, -1},
       {"bytes=0-0", 0, ByteRange::UNSATISFIABLE, 0, -1},
       {"bytes=-1", 0, ByteRange::UNSATISFIABLE, 0, -1},
       // Malformed or several ranges: the whole file, as if no range was asked for.
       {"bytes=0-1,5-6", 1000, ByteRange::WHOLE, 0, -1},
       {"bytes=20-10", 1000, ByteRange::WHOLE, 0, -1},
       {"bytes=a-b", 1000, ByteRange::WHOLE, 0, -1},
       {"bytes=-", 1000, ByteRange::WHOLE, 0, -1},
       {"items=0-1", 1000, ByteRange::WHOLE, 0, -1},
       {"bytes=0-1x", 1000, ByteRange::WHOLE, 0, -1},
       {"bytes=1234567890123456789-", 1000, ByteRange::WHOLE, 0, -1},  // would overflow
   };
   for (const Case& c : cases) {
      SCOPED_TRACE(c.field);
      ByteRange range = ParseRange(c.field, c.size);
      EXPECT_EQ(range.kind, c.kind);
      if (c.kind == ByteRange::PART) {
         EXPECT_EQ(range.first, c.first);
         EXPECT_EQ(range.last, c.last);
      }
   }
}

TEST(ConditionalTest, EntityTagListsMatchByOpaquePart) {
   const std::string tag = "\"1a-2b-3c.4\"";
   EXPECT_TRUE(TagListMatches(tag, tag));
   EXPECT_TRUE(TagListMatches("\"x\", W/\"1a-2b-3c.4\"", tag));
   EXPECT_TRUE(TagListMatches(" * ", tag));
   EXPECT_FALSE(TagListMatches("\"1a-2b-3c.5\"", tag));
   EXPECT_FALSE(TagListMatches("1a-2b-3c.4", tag));  // unquoted is another tag
   EXPECT_FALSE(TagListMatches(", ,", tag));
   EXPECT_FALSE(TagListMatches("", tag));
}

}  // namespace
}  // namespace Pelmora::Http
