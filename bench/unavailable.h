// Skips a benchmark that cannot run, because a peer is not installed or a privilege is missing. By this
// prefix bench_ratios counts its row as not measured instead of failed.
#pragma once

#include <benchmark/benchmark.h>

#include <string>

inline void unavailable(benchmark::State& state, const std::string& why) {
  state.SkipWithError(("unavailable: " + why).c_str());
}
