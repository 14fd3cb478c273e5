// A benchmark that cannot run here, because a peer is not installed or a right is missing, says so with
// a text that begins like this: its row then counts as not measured, and the run as good.
#pragma once

#include <benchmark/benchmark.h>

#include <string>

inline void unavailable(benchmark::State& state, const std::string& why) {
  state.SkipWithError(("unavailable: " + why).c_str());
}
