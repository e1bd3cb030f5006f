#include "protocol/base64.h"

#include <benchmark/benchmark.h>

namespace {

// A name and password, and the longest text that anybody hands in.
constexpr std::int64_t SHORT = 24;
constexpr std::int64_t LONG = 32768;

void Base64Encode(benchmark::State& state) {
    const std::string bytes(static_cast<std::size_t>(state.range(0)), '\x5a');
    for (auto _ : state)
        benchmark::DoNotOptimize(oxBase64::Encode(bytes));
    state.SetBytesProcessed(state.iterations() * state.range(0));
}
BENCHMARK(Base64Encode)->Arg(SHORT)->Arg(LONG);

void Base64Decode(benchmark::State& state) {
    const std::string text = oxBase64::Encode(std::string(static_cast<std::size_t>(state.range(0)), '\x5a'));
    for (auto _ : state)
        benchmark::DoNotOptimize(oxBase64::Decode(text));
    state.SetBytesProcessed(state.iterations() * state.range(0));
}
BENCHMARK(Base64Decode)->Arg(SHORT)->Arg(LONG);

}  // namespace
