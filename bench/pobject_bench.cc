// Deep copy and render of a task-sized message, the two PObject operations
// every IPC request pays for.
#include <benchmark/benchmark.h>

#include "S2S/pobject.h"

namespace {

S2S::PObject TaskMessage() {
  S2S::PObject m;
  for (int i = 0; i < 22; ++i) {
    m["key_" + std::to_string(i)] = "value number " + std::to_string(i);
  }
  S2S::PObject::Array shares;
  for (int i = 0; i < 3; ++i) shares.emplace_back("share" + std::to_string(i));
  m["share_list"] = shares;
  m["id"] = 123456789ull;
  return m;
}

void BM_CopyTaskMessage(benchmark::State& state) {
  S2S::PObject m = TaskMessage();
  for (auto _ : state) {
    S2S::PObject c(m);
    benchmark::DoNotOptimize(c);
  }
}
BENCHMARK(BM_CopyTaskMessage);

void BM_RenderTaskMessage(benchmark::State& state) {
  S2S::PObject m = TaskMessage();
  for (auto _ : state) benchmark::DoNotOptimize(m.toString());
}
BENCHMARK(BM_RenderTaskMessage);

}  // namespace
