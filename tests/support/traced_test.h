// Tests that run with tracing on and with tracing off.
#pragma once

#include <gtest/gtest.h>
#include <stdint.h>

#include <string>

#include "files.h"
#include "records.h"
#include "trails.h"
#include "world.h"

class TracedTest : public testing::TestWithParam<bool> {
 protected:
  // Returns the records since the last call.
  Trail trail() {
    const Trail arrived = records_.trail();
    records_.clear();
    return arrived;
  }
  // The expected records: those of these calls, or none with tracing off.
  template <typename... Calls>
  Trail traced(const Calls&... calls) const {
    return GetParam() ? joined(calls...) : Trail();
  }

  const Umask umask_{022};
  const TempDir temp_;
  Records records_{GetParam() ? kAllEvents : uint64_t{0}};
};

#define INSTANTIATE_TRACED_AND_NOT(suite)                                            \
  INSTANTIATE_TEST_SUITE_P(Tracing, suite, testing::Bool(), [](const auto& tested) { \
    return std::string(tested.param ? "On" : "Off");                                 \
  })

#define TRACED_AND_NOT(suite)         \
  class suite : public TracedTest {}; \
  INSTANTIATE_TRACED_AND_NOT(suite)
