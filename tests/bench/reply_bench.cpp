#include "protocol/reply.h"

#include <benchmark/benchmark.h>

namespace {

void ReplyHeader(benchmark::State& state, const oxHttpStatus& status, const oxHttpContentType& type) {
    const oxReply reply(status, type, -1, 1024, "Last-Modified: Sun, 06 Nov 1994 08:49:37 GMT\r\n");
    for (auto _ : state)
        benchmark::DoNotOptimize(reply.ComposeHeader());
}

void ReplyHeaderPage(benchmark::State& state) {
    ReplyHeader(state, Http::OK_200, Http::TYPE_HTML);
}
// With an Expires date.
void ReplyHeaderImage(benchmark::State& state) {
    ReplyHeader(state, Http::OK_200, Http::TYPE_GIF);
}
void ReplyHeaderNotFound(benchmark::State& state) {
    ReplyHeader(state, Http::NOT_FOUND_404, Http::TYPE_NONE);
}
BENCHMARK(ReplyHeaderPage);
BENCHMARK(ReplyHeaderImage);
BENCHMARK(ReplyHeaderNotFound);

}  // namespace
