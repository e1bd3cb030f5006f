// A users directory and a key of their own for every test of the user database.
#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <map>
#include <string>
#include <vector>

#include "platform/config.h"
#include "platform/encrypt.h"
#include "testing/scratch.h"
#include "users/oxuserbase.h"

class UserBaseTest : public testing::Test {
protected:
    UserBaseTest() {
        SetEncryptionKeyFile(m_scratch.File("ox_remote.key"));
        std::filesystem::create_directory(Directory());
    }
    ~UserBaseTest() override { SetEncryptionKeyFile(DEFAULT_ENCRYPTION_KEY_FILE); }

    std::string Directory() const { return m_scratch.File("users"); }
    std::string PathOf(const std::string& file) const { return Directory() + "/" + file; }
    std::string TextOf(const std::string& file) const { return m_scratch.Read("users/" + file); }
    void Write(const std::string& file, const std::string& text) const { m_scratch.Write("users/" + file, text); }
    void WriteUser(const std::string& file, const std::string& name, const std::string& more = "") const {
        Write(file, "[UserInfo]\nusername=" + name + "\n" + more + "\n");
    }
    // A key of a user file; "-" when it is not there.
    std::string KeyOf(const std::string& file, const char* key, const char* section = "UserInfo") const {
        oxConfig config;
        EXPECT_TRUE(config.Open(PathOf(file))) << file;
        return config.GetText(section, key, "-");
    }
    // What the file holds as the password, in clear.
    std::string PasswordIn(const std::string& file) const {
        std::string clear;
        EXPECT_TRUE(oxDecrypt(KeyOf(file, "password"), clear)) << file;
        return clear;
    }
    // Everything in the directory, sorted.
    std::vector<std::string> Files() const {
        std::vector<std::string> names;
        for (const auto& entry : std::filesystem::directory_iterator(Directory()))
            names.push_back(entry.path().filename());
        std::sort(names.begin(), names.end());
        return names;
    }
    std::map<std::string, std::string> Texts() const {
        std::map<std::string, std::string> texts;
        for (const std::string& name : Files())
            texts[name] = TextOf(name);
        return texts;
    }
    static std::string Sealed(const std::string& clear) {
        std::string sealed;
        EXPECT_TRUE(oxEncrypt(clear, sealed));
        return sealed;
    }
    static std::string ListOf(oxUserBase& users) {
        std::string buffer(65535, '#');
        users.ListUsers(buffer.data(), buffer.size());
        return buffer.c_str();
    }

    Scratch m_scratch;
};

// What the body writes to standard error.
template <typename Body>
std::string StandardErrorOf(const Body& body) {
    testing::internal::CaptureStderr();
    body();
    return testing::internal::GetCapturedStderr();
}
