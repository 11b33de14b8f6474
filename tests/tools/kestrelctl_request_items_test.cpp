#include <gtest/gtest.h>

#include <string>

#include "kestrelctl/request_items.h"

namespace kestrel::kestrelctl {
namespace {

std::string nestedArrays(std::size_t levels) {
  return std::string(levels, '[') + std::string(levels, ']');
}

// An operator's JSON argument can be of any depth; a deep one is refused with
// a message, never taken down with the stack.
TEST(KestrelctlRequestItemsTest, DeeplyNestedJsonIsRefused) {
  std::string error;
  EXPECT_TRUE(plistFromJson(nestedArrays(256), &error)) << error;
  for (std::size_t levels : {257, 200000}) {
    SCOPED_TRACE(levels);
    error.clear();
    EXPECT_FALSE(plistFromJson(nestedArrays(levels), &error));
    EXPECT_EQ(error, "nested deeper than 256 levels");
  }
}

}  // namespace
}  // namespace kestrel::kestrelctl
