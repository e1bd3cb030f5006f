#include "protocol/request.h"

#include <benchmark/benchmark.h>

#include "requests.h"

namespace {

// With the making of the object, as each connection has its own.
void RequestReadAndParse(benchmark::State& state, std::string_view text) {
    FedSocket socket(text);
    for (auto _ : state) {
        oxRequest request;
        if (!socket.ReadInto(request))
            state.SkipWithError("the request was refused");
        benchmark::DoNotOptimize(request.GetPath().data());
    }
    state.SetBytesProcessed(state.iterations() * static_cast<std::int64_t>(text.size()));
}
BENCHMARK_CAPTURE(RequestReadAndParse, Short, SHORT_REQUEST);
BENCHMARK_CAPTURE(RequestReadAndParse, Browser, BROWSER_REQUEST);

}  // namespace
