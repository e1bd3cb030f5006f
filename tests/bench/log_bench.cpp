#include <benchmark/benchmark.h>

#include <memory>

#include "http/httplog.h"
#include "requests.h"

namespace {

const oxSockAddr PEER(0x7f000001, 40000);
constexpr std::time_t NOW = 784111777;

void AccessLogFormat(benchmark::State& state) {
    oxRequest request;
    if (!FedSocket(BROWSER_REQUEST).ReadInto(request))
        state.SkipWithError("the request was refused");
    const oxReply reply(Http::OK_200);
    for (auto _ : state)
        benchmark::DoNotOptimize(oxHttpServerLog::FormatLine(PEER, request, &reply, NOW, 0));
}
BENCHMARK(AccessLogFormat);

// Formatting, lock, stream and the write call. More threads share the one lock and file, as sessions do.
void AccessLogWrite(benchmark::State& state) {
    static std::unique_ptr<oxHttpServerLog> log;
    if (state.thread_index() == 0) {
        log = std::make_unique<oxHttpServerLog>();
        log->Open("/dev/null", "a");
    }
    oxRequest request;
    const oxReply reply(Http::OK_200);
    for (auto _ : state)
        log->LogRequest(PEER, request, &reply, NOW);
    if (state.thread_index() == 0)
        log.reset();
}
BENCHMARK(AccessLogWrite)->Threads(1)->Threads(4)->UseRealTime();

// A stamped line of the audit log, and one that the level filters.
void AuditLine(benchmark::State& state) {
    oxAuditFile audit("/dev/null", "a");
    audit.SetDebugLevel(5);
    const int level = static_cast<int>(state.range(0));
    for (auto _ : state)
        audit.Printf(level, "Connection from %s, port %d.", "127.0.0.1", 40000);
}
BENCHMARK(AuditLine)->ArgName("level")->Arg(5)->Arg(7);

}  // namespace
