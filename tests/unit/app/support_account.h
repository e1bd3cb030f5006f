// An account of the operating system for this program's tests, which see no other: support_account.cpp stands in for
// the look-up in the passwd file.
#pragma once

#include <string>

// While it lives, the account is there, with the password PASSWORD.
class TestAccount {
public:
    static constexpr const char* PASSWORD = "in passwd";

    explicit TestAccount(const std::string& name);
    ~TestAccount();
    TestAccount(const TestAccount&) = delete;
    TestAccount& operator=(const TestAccount&) = delete;

    // How often it was looked for since it is there, under whatever name.
    static int LookUps();
};
