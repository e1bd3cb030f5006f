// What the tests of replies share: the fixed header lines, files in memory, sending over a connection.
#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <string>
#include <thread>
#include <vector>

#include "protocol/reply.h"
#include "protocol/testsockets.h"
#include "testing/manualclock.h"

inline const std::string DATE = "Date: Sun, 06 Nov 1994 08:49:37 GMT\r\n";
inline const std::string EXPIRES = "Expires: Tue, 06 Dec 1994 08:49:37 GMT\r\n";
inline const std::string SERVER = "Server: Orvex HTTP Server V3.5c\r\n";
inline const std::string ALLOW = "Allow: GET, POST\r\n";

inline std::string OkHeader(const std::string& type) {
    return "HTTP/1.0 200 OK\r\n" + SERVER + ALLOW + "Content-Type: " + type + "\r\n" + DATE + "\r\n";
}

// A descriptor from which the content is read.
inline int FileOf(const std::string& content) {
    const int file = ::memfd_create("body", MFD_CLOEXEC);
    EXPECT_GE(file, 0);
    EXPECT_TRUE(WriteAll(file, content.data(), content.size()));
    ::lseek(file, 0, SEEK_SET);
    return file;
}

inline bool IsOpen(int descriptor) {
    return ::fcntl(descriptor, F_GETFD) != -1;
}

struct Sent {
    std::string text;
    std::vector<std::string> lines;
    std::uint32_t bytes;
    std::int64_t touched;
};

inline Sent Send(oxReply& reply, Connection::Kind kind = Connection::STREAM) {
    Connection connection(kind);
    LineLog log;
    ManualClock clock;
    oxTimeStamp stamp(clock);
    reply.SetClock(clock);
    std::string text;
    std::jthread peer([&] { text = connection.PeerReadAll(); });
    reply.Send(connection.Server(), stamp, log);
    connection.Server().Shutdown(SHUT_WR);
    peer.join();
    return {text, log.Lines(), reply.GetBytesSent(), stamp.Seconds()};
}

// Puts a function into the socket's table for the life of the object.
class SendStub {
public:
    explicit SendStub(ssize_t (*function)(int, const void*, size_t, int)) { oxSocket::m_lpfnsend = function; }
    ~SendStub() { oxSocket::m_lpfnsend = ::send; }
};
