#include "daemon/errors.h"

#include <gtest/gtest.h>

#include "daemon/exceptions.h"
#include "daemon/log.h"
#include "support/fake_services.h"

namespace kestrel {
namespace {

class ErrorsTest : public ::testing::Test {
 protected:
  testing::FakeServices fakes;
};

TEST_F(ErrorsTest, ErrorsKeepTheirOriginAndLogOnlyWhenAskedTo) {
  // Silent and formatless errors log nothing but keep their origin.
  KSTErrorRef silent = KST_ERROR(kKSTErrorNotFound, nullptr, false,
                                 "Container with identifier: \"%@\" Not Found", "x");
  KSTErrorRef bare = KSTCreateError("f", 5, kKSTErrorDomain, kKSTErrorException,
                                    KST_POSIX_ERROR(EIO, "io"), nullptr, true, nullptr);
  EXPECT_TRUE(fakes.logging->lines().empty());
  EXPECT_EQ(silent->localizedDescription(), "Container with identifier: \"x\" Not Found");
  EXPECT_FALSE(bare->localizedDescription().has_value());
  EXPECT_EQ(*bare->userInfo().at(kKSTFunctionNameKey).string(), "f");
  EXPECT_EQ(bare->userInfo().at(kKSTSourceFileLineKey).signedInteger(), 5);

  // A logged error carries its message, function and line, and logs them.
  KSTErrorRef underlying = KST_POSIX_ERROR(ENOENT, "open failed");
  KSTErrorRef error =
      KSTCreateError("makeThing", 77, kKSTErrorDomain, kKSTErrorNotFound, underlying, nullptr, true,
                     "No Container with userId: %u", 501u);
  EXPECT_EQ(error->domain(), kKSTErrorDomain);
  EXPECT_EQ(error->code(), 21);
  EXPECT_EQ(error->localizedDescription(), "No Container with userId: 501");
  EXPECT_EQ(*error->userInfo().at(kKSTFunctionNameKey).string(), "makeThing");
  EXPECT_EQ(error->userInfo().at(kKSTSourceFileLineKey).signedInteger(), 77);
  EXPECT_EQ(error->underlyingError(), underlying);
  EXPECT_TRUE(fakes.logging->contains(
      "makeThing", "77: No Container with userId: 501 (" + underlying->description() + ")"));

  KST_ERROR(kKSTErrorInvalidObject, nullptr, true, "Can't act on an invalid object: userId: %u",
            3u);
  const auto lines = fakes.logging->lines();
  ASSERT_FALSE(lines.empty());
  EXPECT_EQ(lines.back().level, kLogError);
  EXPECT_EQ(lines.back().tag, "TestBody");
  EXPECT_TRUE(lines.back().message.ends_with(": Can't act on an invalid object: userId: 3"));
}

TEST_F(ErrorsTest, CodeHandOverWidensTheSignedCodeAndSkipsAbsentTargets) {
  std::uint64_t code = kKSTSuccess;
  KSTHandOverCode(KST_ERROR(kKSTErrorDeleteFailed, nullptr, false, nullptr), &code);
  EXPECT_EQ(code, 28u);
  KSTHandOverCode(KSTCreateError("f", 1, kKSTErrorDomain, -1, nullptr, nullptr, false, nullptr),
                  &code);
  EXPECT_EQ(code, UINT64_MAX);
  KSTHandOverCode(
      KSTCreateError("f", 1, kKSTErrorDomain, 0x100000005LL, nullptr, nullptr, false, nullptr),
      &code);
  EXPECT_EQ(code, 5u);
  KSTHandOverCode(KST_ERROR(kKSTErrorDeleteFailed, nullptr, false, nullptr), nullptr);  // no crash

  KSTErrorRef posix = KST_POSIX_ERROR(EACCES, "Failed to open %s", "/x");
  EXPECT_TRUE(posix->isPOSIXError(EACCES));
  EXPECT_EQ(posix->localizedDescription(), "Failed to open /x");
}

int throwingOperation(std::uint64_t* code) {
  return KST_CATCH_EXCEPTIONS(
      code, -1, [&]() -> int { throw KSTException("InvalidArgumentException", "bad thing"); });
}

TEST_F(ErrorsTest, ExceptionOnNonInternalBuildBecomesCode40AndTheDaemonGoesOn) {
  std::uint64_t code = kKSTSuccess;
  EXPECT_EQ(throwingOperation(&code), -1);
  EXPECT_EQ(code, kKSTErrorException);
  const auto lines = fakes.logging->lines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].tag, "throwingOperation");
  EXPECT_EQ(lines[0].level, kLogError);
  EXPECT_NE(lines[0].message.find(": Got exception: bad thing : ("), std::string::npos);

  std::uint64_t other = kKSTSuccess;
  KST_CATCH_EXCEPTIONS(&other, [] { throw std::runtime_error("std failure"); });
  EXPECT_EQ(other, kKSTErrorException);
  std::uint64_t untouched = kKSTSuccess;
  EXPECT_EQ(KST_CATCH_EXCEPTIONS(&untouched, 0, [] { return 7; }), 7);
  EXPECT_EQ(untouched, kKSTSuccess);
}

TEST_F(ErrorsTest, ExceptionOnInternalBuildWritesTheReportAndAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  fakes.deviceInfo->setInternalBuild(true);
  std::uint64_t code = kKSTSuccess;
  EXPECT_DEATH(throwingOperation(&code),
               "\\*\\* INTERNAL ERROR: Uncaught Exception \\*\\*\nException: .*"
               "InvalidArgumentException: bad thing\nStack:\n");
}

}  // namespace
}  // namespace kestrel
