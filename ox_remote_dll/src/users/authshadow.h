// The shadow file.
#pragma once

#include "users/authenticate.h"

// Needs root, which it raises its thread to for the look-up. An empty password field accepts nothing.
class oxAuthShadow : public oxAuthenticate {
public:
    oxAuthShadow(const char* user, const char* password);
    bool Authenticate(const char* user, const char* password) override;
};
