#include "platform/uuid.h"

#include <gtest/gtest.h>

namespace kestrel::platform {
namespace {

TEST(UuidTest, OnlyTheCanonicalFormParses) {
  const struct {
    const char* text;
    bool parses;
  } rows[] = {
      {"0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0", true},
      {"0f1e2d3c-4b5a-6978-8796-a5b4c3d2e1f0", true},
      {"0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F", false},    // short
      {"0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F00", false},  // long
      {"0F1E2D3C4-B5A-6978-8796-A5B4C3D2E1F0", false},   // hyphen moved
      {"0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1G0", false},   // not hexadecimal
      {"{F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F}", false},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.text);
    const std::optional<Uuid> uuid = Uuid::parse(row.text);
    ASSERT_EQ(uuid.has_value(), row.parses);
    if (uuid) {
      EXPECT_EQ(uuid->string(), "0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0");
    }
  }
  EXPECT_FALSE(Uuid::parse(std::string_view("0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F\0", 36)));
}

}  // namespace
}  // namespace kestrel::platform
