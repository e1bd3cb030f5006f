// Runs a piece of a test as somebody whom file modes hold back.
#pragma once

#include <gtest/gtest.h>
#include <unistd.h>

#include <thread>

#include "platform/identitycalls.h"

// Root's part is played by a thread that is root no more; the process stays what it is.
template <typename Body>
void AsOrdinaryUser(const Body& body) {
    std::thread([&] {
        if (geteuid() == ROOT_USER) {
            constexpr uid_t ORDINARY_USER = 1;
            ASSERT_EQ(0, syscall(SET_USERS_CALL, ORDINARY_USER, ORDINARY_USER, ORDINARY_USER));
        }
        body();
    }).join();
}
