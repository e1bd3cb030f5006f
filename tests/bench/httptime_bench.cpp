#include "protocol/httptime.h"

#include <benchmark/benchmark.h>

namespace {

void HttpTimeFormat(benchmark::State& state) {
    const oxHttpTime time(std::time_t{784111777});
    char text[oxHttpTime::FORMAT_BYTES];
    for (auto _ : state) {
        benchmark::DoNotOptimize(time.Format(text));
        benchmark::DoNotOptimize(text);
    }
}
BENCHMARK(HttpTimeFormat);

void HttpTimeParse(benchmark::State& state, const char* text) {
    for (auto _ : state) {
        const std::time_t value = oxHttpTime(text).Value();
        if (value == 0)
            state.SkipWithError("the text was not taken for a date");
        benchmark::DoNotOptimize(value);
    }
}
BENCHMARK_CAPTURE(HttpTimeParse, Rfc1123, "Sun, 06 Nov 1994 08:49:37 GMT");
BENCHMARK_CAPTURE(HttpTimeParse, Rfc850, "Sunday, 06-Nov-94 08:49:37 GMT");
BENCHMARK_CAPTURE(HttpTimeParse, Asctime, "Sun Nov  6 08:49:37 1994");

}  // namespace
