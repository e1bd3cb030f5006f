// Accounts made for a test: the helper program runs where the machine's account files are the test's own.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "testing/scratch.h"

// What the helper program did.
struct HelperRun {
    int status = -1;                  // its exit status, 128 + the number of the signal that ended it
    std::vector<std::string> lines;   // of its standard output
    std::vector<std::string> errors;  // its writes to standard error, one entry each
};

// A hash for a passwd or shadow field, cheap to compute. Prefixes: "$6$", "$y$".
std::string HashOf(const std::string& password, const std::string& prefix = "$6$");

// Whether the process may become any user.
bool IsRoot();

class TestAccounts {
public:
    static constexpr int NO_OVERLAY = 77;  // the status of a run whose library could not be planted

    TestAccounts();

    // Whether the kernel lets the helper have account files of its own: for root always, else in a user namespace.
    static bool Possible();

    // A passwd line; with a shadow field a shadow line too, whose account expired long ago where asked for.
    void Add(const std::string& name, const std::string& passwdField,
             const std::optional<std::string>& shadowField = std::nullopt, bool expired = false);
    void AddPasswdLine(const std::string& line) { m_passwd += line + "\n"; }
    void AddShadowLine(const std::string& line) { m_shadow += line + "\n"; }
    // "/lib/libpam.so" is a copy of this file.
    void PlantPam(const std::string& library) { m_planted = library; }
    // "libpam.so.0" is this file, wherever the system has it.
    void ReplacePam(const std::string& library) { m_replacement = library; }

    HelperRun Run(const std::vector<std::string>& steps);
    // Without account files of its own.
    HelperRun RunPlainly(const std::vector<std::string>& steps);

    // The fake PAM library's plan and what it recorded.
    void Plan(const std::string& plan) { m_files.Write("plan", plan); }
    std::vector<std::string> PamCalls() const { return m_files.Lines("calls"); }
    // The directory that the helper runs in; anybody may write there.
    const Scratch& Directory() const { return m_directory; }

private:
    HelperRun Spawn(const std::vector<std::string>& command);

    Scratch m_files;
    Scratch m_directory;
    std::string m_passwd;
    std::string m_shadow;
    std::string m_planted;
    std::string m_replacement;
};

// The fake PAM library, whole or without one of its functions.
std::string FakePam(const std::string& without = "");

#define SKIP_WITHOUT_ACCOUNTS()    \
    if (!TestAccounts::Possible()) \
    GTEST_SKIP() << "the kernel does not allow a mount namespace"

#define SKIP_UNLESS_ROOT() \
    if (!IsRoot())         \
    GTEST_SKIP() << "needs root"
