// The two log files of the HTTP server.
#pragma once

#include <atomic>
#include <cstdint>
#include <ctime>
#include <string>

#include "net/socketaddress.h"
#include "protocol/reply.h"
#include "protocol/request.h"
#include "support/auditfile.h"
#include "support/errorsink.h"

// The access log: one line per answered request, without a time stamp of its own and whatever the debug level: only the
// "WebLogging" setting switches it.
class oxHttpServerLog : public oxAuditFile {
public:
    oxHttpServerLog();
    const char* Stamp() override;

    // Writes the line of an answered request; thread-safe.
    void LogRequest(const oxSockAddr& peer, const oxRequest& request, const oxReply* reply, std::time_t now);
    // The line itself. `zone` is the C library's `timezone`: seconds west of UTC. Without a reply the line ends with
    // "400 0".
    static std::string FormatLine(const oxSockAddr& peer, const oxRequest& request, const oxReply* reply,
                                  std::time_t now, std::int32_t zone);
};

// The message log: error lines and lines with a level (3 server events, 5 sessions and threads, 7 connection tracing).
// Writes nothing while it is not open.
class oxHttpErrorLog : public oxAuditFile, public oxErrorSink {
public:
    bool Open(const char* fileName);
    void Close() override;
    void Error(const char* format, ...) override __attribute__((format(printf, 2, 3)));
    void Log(int level, const char* format, ...) __attribute__((format(printf, 3, 4)));

private:
    using oxAuditFile::Error;
    using oxAuditFile::Open;
    std::atomic<bool> m_open{false};
};
