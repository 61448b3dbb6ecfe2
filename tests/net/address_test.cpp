// Address resolution and the texts of binding information.

#include <gtest/gtest.h>

#include "pelmora/system.h"

namespace Pelmora::System {
namespace {

TEST(AddressTest, ResolvesNumericNamedAndPassiveAddresses) {
   std::vector<Ref<InetBindingInfo>> found;
   ResolveAddress("127.0.0.1", 8080, false, found);
   ASSERT_EQ(1u, found.size());
   EXPECT_EQ("127.0.0.1", found[0]->GetAddress());
   EXPECT_EQ(8080, found[0]->GetPort());
   EXPECT_FALSE(found[0]->IsV6());
   EXPECT_EQ("127.0.0.1:8080", found[0]->ToString());

   ResolveAddress("::1", 443, false, found);
   ASSERT_EQ(1u, found.size());
   EXPECT_TRUE(found[0]->IsV6());
   EXPECT_EQ("[::1]:443", found[0]->ToString());

   ResolveAddress("localhost", 1, false, found);
   EXPECT_FALSE(found.empty());

   // Listening on every address: the IPv4 wildcard.
   ResolveAddress("", 0, true, found);
   ASSERT_FALSE(found.empty());
   EXPECT_EQ("0.0.0.0", found[0]->GetAddress());

   EXPECT_THROW(ResolveAddress("no-such-host.invalid", 80, false, found), NotFoundException);
   EXPECT_TRUE(found.empty());
   EXPECT_EQ("unix:/run/x.sock", LocalBindingInfo("/run/x.sock").ToString());
}

}  // namespace
}  // namespace Pelmora::System
