// Streams over pipes: reading one, writing the other, ending with the writer's close.

#include <fcntl.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <string>

#include "tests/support/netFixture.h"

namespace Pelmora::System {
namespace {

TEST(DescriptorStreamTest, ReadsOnePipeWritesAnotherAndLeavesTheGivenDescriptorsOpen) {
   NetTesting::EnsurePool();
   int input[2];
   int output[2];
   ASSERT_EQ(0, ::pipe(input));
   ASSERT_EQ(0, ::pipe(output));
   Ref<Stream> stream;
   CreateDescriptorStream(input[0], output[1], stream);

   ASSERT_EQ(3, ::write(input[1], "abc", 3));
   char buffer[16];
   EXPECT_EQ(3, stream->Read(buffer, sizeof buffer));
   EXPECT_EQ("abc", std::string(buffer, 3));
   EXPECT_EQ(4, stream->Write("wxyz", 4));
   ASSERT_EQ(4, ::read(output[0], buffer, sizeof buffer));
   EXPECT_EQ("wxyz", std::string(buffer, 4));

   // The writer's close ends the stream.
   ::close(input[1]);
   EXPECT_EQ(0, stream->Read(buffer, sizeof buffer));
   stream->Close();
   // The stream closed its duplicates only: our ends still work.
   EXPECT_NE(-1, ::fcntl(input[0], F_GETFD));
   ASSERT_EQ(2, ::write(output[1], "ok", 2));
   ASSERT_EQ(2, ::read(output[0], buffer, sizeof buffer));
   for (int fd : {input[0], output[0], output[1]}) ::close(fd);

   EXPECT_THROW(CreateDescriptorStream(-1, 1, stream), SystemException);
}

}  // namespace
}  // namespace Pelmora::System
