#include "unix/theserver.h"

#include <cstdlib>
#include <memory>
#include <mutex>

#include "platform/thread.h"

namespace {
std::once_flag built;
std::unique_ptr<oxxHttpServer> server;
}  // namespace

oxxHttpServer& theServer() {
    MThread::Once(built, [] {
        server = std::make_unique<oxxHttpServer>();
        std::atexit([] { server.reset(); });
    });
    return *server;
}
