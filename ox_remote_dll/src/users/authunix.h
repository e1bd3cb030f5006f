// The passwd file.
#pragma once

#include "users/authenticate.h"

// An entry whose password lives elsewhere ("x") never matches; an empty password field accepts any password.
class oxAuthUnix : public oxAuthenticate {
public:
    oxAuthUnix(const char* user, const char* password);
    bool Authenticate(const char* user, const char* password) override;
};
