#include "unix/theserver.h"

#include <cstdlib>
#include <memory>
#include <mutex>

#include "platform/thread.h"

namespace {
std::once_flag built;
std::unique_ptr<oxHttpServer> server;
}  // namespace

oxHttpServer& theServer() {
    MThread::Once(built, [] {
        server = std::make_unique<oxHttpServer>();
        std::atexit([] { server.reset(); });
    });
    return *server;
}
