// The one server object of the process.
#pragma once

#include "app/oxxhttpserver.h"

// Builds the server on first use, once also when several threads ask at the same time, and destroys it at process exit,
// before every static object that was built earlier. Only the server process may call it: the commands that query or
// stop a running server must not build one of their own.
oxxHttpServer& theServer();
