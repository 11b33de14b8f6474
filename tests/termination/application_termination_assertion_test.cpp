// The termination assertion over the platform's lifecycle service: what it
// asks for, what it waits for, and the invariant that nothing it holds is
// forgotten.
#include "termination/application_termination_assertion.h"

#include <gtest/gtest.h>

#include "support/fake_services.h"

namespace kestrel {
namespace {

using platform::TerminationReason;

constexpr const char* kApp = "com.example.app";

TEST(ApplicationTerminationAssertionTest, HoldsTheAppFromCreationToInvalidation) {
  testing::FakeServices fakes;
  const struct {
    int reason;
    TerminationReason platformReason;
  } rows[] = {{0, TerminationReason::Installation},
              {1, TerminationReason::CacheDeletion},
              {255, TerminationReason::Critical}};
  for (const auto& row : rows) {
    SCOPED_TRACE(row.reason);
    auto assertion = KSTApplicationTerminationAssertion::initWithBundleIdentifier(kApp, row.reason);
    ASSERT_TRUE(assertion);
    EXPECT_EQ(fakes.applicationLifecycle->acquisitions().back().reason, row.platformReason);
    EXPECT_TRUE(fakes.applicationLifecycle->isHeldTerminated(kApp));
    assertion->invalidate();
    assertion->invalidate();
    EXPECT_FALSE(fakes.applicationLifecycle->isHeldTerminated(kApp));
  }
  EXPECT_EQ(fakes.applicationLifecycle->invalidations(), 3u);
  EXPECT_TRUE(fakes.logged("Holding com.example.app terminated: no process running"));
}

TEST(ApplicationTerminationAssertionTest, WhatThePlatformRefusesLeavesNothingHeld) {
  testing::FakeServices fakes;
  platform::TerminationReport failed;
  failed.error = "cannot send signal 15 to pid 7: Operation not permitted";
  fakes.applicationLifecycle->setReport(failed);
  EXPECT_FALSE(KSTApplicationTerminationAssertion::initWithBundleIdentifier(kApp, 0));
  EXPECT_FALSE(fakes.applicationLifecycle->isHeldTerminated(kApp));
  EXPECT_TRUE(fakes.logged("Failed to acquire termination assertion for com.example.app : "
                           "no process running; cannot send signal 15"));

  fakes.applicationLifecycle->setUnavailable(true);
  EXPECT_FALSE(KSTApplicationTerminationAssertion::initWithBundleIdentifier(kApp, 0));
  EXPECT_TRUE(fakes.logged("Could not get a termination assertion for com.example.app"));
}

TEST(ApplicationTerminationAssertionDeathTest, ForgottenAssertionsAndUnknownReasonsStopTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        testing::FakeServices fakes;
        auto held = KSTApplicationTerminationAssertion::initWithBundleIdentifier(kApp, 0);
        held.reset();
      },
      "nullptr == termAssertion_");
  EXPECT_DEATH(
      {
        testing::FakeServices fakes;
        KSTApplicationTerminationAssertion::initWithBundleIdentifier(kApp, 7);
      },
      "Unknown reason: 7");
}

}  // namespace
}  // namespace kestrel
