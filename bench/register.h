// Registering a benchmark from a callable, for the matching and index
// benchmarks.
#ifndef ZORVNOTIFYD_BENCH_REGISTER_H_
#define ZORVNOTIFYD_BENCH_REGISTER_H_

#include <string>

#include <benchmark/benchmark.h>

namespace zorv_bench {

// Registers the benchmark |name| running |body| once per iteration, labelled
// with |label| (the setup or the baseline it measures).
template <typename Body>
void Register(const std::string& name, const std::string& label, Body body) {
  benchmark::RegisterBenchmark(name.c_str(), [label, body](benchmark::State& state) {
    for (auto _ : state) body();
    state.SetLabel(label);
  })->Unit(benchmark::kNanosecond);
}

}  // namespace zorv_bench

#endif  // ZORVNOTIFYD_BENCH_REGISTER_H_
