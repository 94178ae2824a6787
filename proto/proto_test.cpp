#include <gtest/gtest.h>

#include "tavix_proto/tavix_error.pb.h"

namespace {

TEST(Proto, ErrorRecordRoundTripsOnTheWire) {
  tavix::proto::TVXError error;
  error.set_domain("kTVXErrorDomain");
  error.set_code(404);
  error.set_reason("resource not found");
  std::string bytes;
  ASSERT_TRUE(error.SerializeToString(&bytes));
  tavix::proto::TVXError back;
  ASSERT_TRUE(back.ParseFromString(bytes));
  EXPECT_EQ(back.code(), 404);
  EXPECT_EQ(back.reason(), "resource not found");
  EXPECT_FALSE(back.ParseFromString(std::string("\xff\xff\xff", 3)));
}

}  // namespace
