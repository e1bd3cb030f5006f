// User files: whatever the text, nobody gets in through a damaged one, and a rewritten one says the same.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <string_view>

#include "platform/config.h"
#include "platform/encrypt.h"
#include "users/oxuserbase.h"
#include "users/userfile.h"

namespace {

constexpr const char* SECTION = oxUserBase::m_pszINI_SECTION_USER_INFO;
constexpr const char* UNKNOWN_KEY = "email";
constexpr const char* UNKNOWN_SECTION = "Other";

void Check(bool holds) {
    if (!holds)
        std::abort();
}

// A key of its own for the run.
class Installation {
public:
    Installation() {
        std::string directory = (std::filesystem::temp_directory_path() / "ox_fuzz_XXXXXX").string();
        Check(mkdtemp(directory.data()) != nullptr);
        m_directory = directory;
        SetEncryptionKeyFile(directory + "/ox_remote.key");
    }
    ~Installation() {
        std::error_code ignored;
        std::filesystem::remove_all(m_directory, ignored);
    }
    Installation(const Installation&) = delete;
    Installation& operator=(const Installation&) = delete;

private:
    std::string m_directory;
};

void CheckContent(const oxUserFile::Content& content) {
    using enum oxUserFile::State;
    const oxUserRecord& record = content.record;
    Check(content.state == NoUser || !record.name.empty());
    Check(content.state == User || record.password.empty());
    Check(record.password.size() <= oxUserBase::MAX_PASSWORD);
    Check(!content.isPlaintext || record.password.size() <= oxUserBase::MAX_PLAINTEXT_PASSWORD);
    Check(record.text1.size() <= oxUserBase::MAX_TEXT && record.text2.size() <= oxUserBase::MAX_TEXT);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const Installation installation;
    const std::string_view text(reinterpret_cast<const char*>(data), size);
    const oxUserFile::Content content = oxUserFile::Parse(text);
    CheckContent(content);
    oxConfig before;
    const bool loads = before.OpenText(text);
    if (!loads || !before.HasSection(SECTION))
        Check(content.state == oxUserFile::State::NoUser);
    // A password that stands in the file never opens the account to everybody.
    if (content.state == oxUserFile::State::User && !before.GetText(SECTION, "password", "").empty()) {
        std::string clear;
        Check(oxDecrypt(before.GetText(SECTION, "password", ""), clear) && clear == content.record.password);
    }

    std::string rewritten;
    if (!oxUserFile::Compose(text, content.record, rewritten)) {
        Check(!loads);
        return 0;
    }
    oxConfig after;
    Check(after.OpenText(rewritten));
    Check(!after.HasKey(SECTION, "PlaintextPassword"));
    Check(after.GetText(SECTION, UNKNOWN_KEY, "") == before.GetText(SECTION, UNKNOWN_KEY, ""));
    for (const char* key : {"username", "password", UNKNOWN_KEY})
        Check(after.GetText(UNKNOWN_SECTION, key, "") == before.GetText(UNKNOWN_SECTION, key, ""));
    const oxUserFile::Content again = oxUserFile::Parse(rewritten);
    CheckContent(again);
    if (content.state == oxUserFile::State::User) {
        Check(again.state == oxUserFile::State::User && !again.isPlaintext);
        Check(again.record == content.record);
    }
    return 0;
}
