#include "users/oxuserbase.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <mutex>
#include <utility>
#include <vector>

#include "platform/encrypt.h"
#include "platform/text.h"
#include "users/keyvaluemap.h"

namespace {

constexpr const char* ANONYMOUS = "anonymous";

bool HasControls(const std::string& text) {
    return std::any_of(text.begin(), text.end(), IsControl);
}

// What a browser can send (a colon ends the name), what the texts for scripts can carry, and what a settings file gives
// back unchanged.
bool IsName(const std::string& name) {
    return !name.empty() && name.size() <= oxUserBase::MAX_NAME && !HasControls(name) &&
           name.find_first_of(":&=") == std::string::npos && name.front() != ' ' && name.back() != ' ';
}

bool IsText(const std::string& text) {
    return text.size() <= oxUserBase::MAX_TEXT && !HasControls(text);
}

// As the settings file will give it back.
std::string WithoutOuterBlanks(const std::string& text) {
    const auto first = text.find_first_not_of(' ');
    return first == std::string::npos ? std::string() : text.substr(first, text.find_last_not_of(' ') - first + 1);
}

}  // namespace

oxUserBase::oxUserBase() = default;

oxUserBase::oxUserBase(const std::string& directory) {
    Open(directory);
}

oxUserBase::~oxUserBase() = default;

bool oxUserBase::Open(const std::string& directory) {
    const std::scoped_lock changing(m_changing);
    if (directory != m_directory.Path()) {
        const std::scoped_lock lock(m_mutex);
        m_directory = oxUserDirectory(directory);
        m_files.clear();
        if (!std::exchange(m_users, Users()).empty())
            ++m_generation;
    }
    const Files before = m_files;
    const bool loaded = Load();
    // Whoever starts or resets the server is told again what else is told once.
    for (const auto& [name, file] : m_files) {
        const auto old = before.find(name);
        if (old != before.end() && old->second->content == file->content && old->second->stamp == file->stamp)
            Report(*file);
    }
    return loaded;
}

bool oxUserBase::LoadAll() {
    const std::scoped_lock changing(m_changing);
    return Load();
}

bool oxUserBase::SaveUser(const std::string& name) {
    const std::scoped_lock changing(m_changing);
    const oxUserDirectory::Lock directoryLock(m_directory);
    const std::scoped_lock lock(m_mutex);
    FilePointer* const file = Find(name);
    if (file == nullptr)
        return false;
    auto written = std::make_shared<File>(**file);
    written->content.isPlaintext = false;
    written->readAgain = true;
    if (!Store(*written))
        return false;
    *file = std::move(written);
    return true;
}

bool oxUserBase::Change(const std::string& name, const std::function<void(oxUserRecord&)>& change) {
    const std::scoped_lock changing(m_changing);
    const oxUserDirectory::Lock directoryLock(m_directory);
    const std::scoped_lock lock(m_mutex);
    if (Reload() != 0)
        return false;
    FilePointer* const file = Find(name);
    if (file == nullptr)
        return false;
    auto changed = std::make_shared<File>(**file);
    change(changed->content.record);
    changed->content.isPlaintext = false;
    changed->readAgain = true;
    if (!Store(*changed))
        return false;
    *file = std::move(changed);
    ++m_generation;
    return true;
}

bool oxUserBase::Authenticate(const std::string& name, const std::string& password, std::uint32_t* permissions) {
    const std::scoped_lock lock(m_mutex);
    const FilePointer* const file = Find(name);
    if (file == nullptr)
        return false;
    const oxUserRecord& record = (*file)->content.record;
    // A user without a password is open to everybody, on purpose.
    if (!record.password.empty() && !EqualSecrets(record.password, password))
        return false;
    if (permissions != nullptr)
        *permissions = record.permissions;
    return true;
}

bool oxUserBase::AddUser(const std::string& name, const std::string& password, std::uint32_t permissions,
                         const std::string& maxProfiles, const std::string& logFileUrl) {
    if (!AllowsAnonymousUser() && name == ANONYMOUS)
        return false;
    if (!IsName(name) || password.size() > MAX_PASSWORD || !IsText(maxProfiles) || !IsText(logFileUrl))
        return false;
    const std::scoped_lock changing(m_changing);
    const oxUserDirectory::Lock directoryLock(m_directory);
    const std::scoped_lock lock(m_mutex);
    // The first user of an installation makes the directory; users that cannot be listed might hold the name. Where a
    // file is in the way there are none, and making the directory tells.
    const int error = Reload();
    if ((error != 0 && error != ENOENT && error != ENOTDIR) || HasFile(name))
        return false;
    if (!m_directory.Create()) {
        std::fputs("Couldn't create user config directory.\n", stderr);
        return false;
    }
    auto file = std::make_shared<File>();
    file->content.state = oxUserFile::State::User;
    file->content.record.name = name;
    file->content.record.password = password;
    file->content.record.permissions = permissions;
    file->content.record.text1 = WithoutOuterBlanks(logFileUrl);
    file->content.record.text2 = WithoutOuterBlanks(maxProfiles);
    std::string text;
    if (!oxUserFile::Compose("", file->content.record, text) || !m_directory.Add(name, text, file->name))
        return false;
    m_users[name] = file->name;
    m_files[file->name] = file;
    ++m_generation;
    return true;
}

bool oxUserBase::DeleteUser(const std::string& name) {
    if (name.empty())
        return false;  // files that are nobody's are not to go
    const std::scoped_lock changing(m_changing);
    const oxUserDirectory::Lock directoryLock(m_directory);
    const std::scoped_lock lock(m_mutex);
    if (Reload() != 0)
        return false;
    // The file that counts goes last: until then nothing has changed for the user.
    const auto user = m_users.find(name);
    const std::string counting = user != m_users.end() ? user->second : std::string();
    std::vector<std::string> fileNames;
    for (const auto& [fileName, file] : m_files) {
        if (file->content.record.name == name && fileName != counting)
            fileNames.push_back(fileName);
    }
    if (!counting.empty())
        fileNames.push_back(counting);
    for (const std::string& fileName : fileNames) {
        if (!m_directory.Remove(fileName))
            return false;
        if (fileName != counting)
            m_files.erase(fileName);
    }
    if (!counting.empty()) {
        m_users.erase(user);
        m_files.erase(counting);
        ++m_generation;
    }
    return !fileNames.empty();
}

bool oxUserBase::SetPermissions(const std::string& name, std::uint32_t permissions) {
    return Change(name, [&](oxUserRecord& record) { record.permissions = permissions; });
}

bool oxUserBase::SetPassword(const std::string& name, const std::string& password) {
    return password.size() <= MAX_PASSWORD && Change(name, [&](oxUserRecord& record) {
               WipeText(record.password);
               record.password = password;
           });
}

bool oxUserBase::SetText1(const std::string& name, const std::string& text) {
    return IsText(text) && Change(name, [&](oxUserRecord& record) { record.text1 = WithoutOuterBlanks(text); });
}

bool oxUserBase::SetText2(const std::string& name, const std::string& text) {
    return IsText(text) && Change(name, [&](oxUserRecord& record) { record.text2 = WithoutOuterBlanks(text); });
}

bool oxUserBase::GetPermissionsText(const std::string& name, char* buffer, std::size_t size) {
    std::uint32_t permissions = 0;
    return FindUser(name, &permissions) &&
           KeyValueMap::Append(buffer, size, m_pszINI_KEY_PERMISSIONS, static_cast<int>(permissions)) > 0;
}

bool oxUserBase::AllowsAnonymousUser() {
    return true;
}

void oxUserBase::ListUsers(char* buffer, std::size_t size) {
    if (size == 0)
        return;
    buffer[0] = '\0';
    const std::scoped_lock lock(m_mutex);
    std::size_t length = 0;
    int number = 0;
    for (const auto& [name, fileName] : m_users) {
        if (size - length <= LIST_ROOM)
            return;
        ++number;
        const std::uint32_t permissions = m_files.find(fileName)->second->content.record.permissions;
        // Both pairs of a user, or none: the list stays well-formed.
        char* const end = buffer + length;
        if (KeyValueMap::Append(buffer, size, m_pszTOKEN_KEY_USERNAME, number, name.c_str()) == 0 ||
            KeyValueMap::Append(buffer, size, m_pszTOKEN_KEY_PERMISSIONS, number, static_cast<int>(permissions)) == 0) {
            *end = '\0';
            return;
        }
        length += std::strlen(end);
    }
}

bool oxUserBase::FindUser(const std::string& name, std::uint32_t* permissions) {
    const std::scoped_lock lock(m_mutex);
    const FilePointer* const file = Find(name);
    if (file != nullptr && permissions != nullptr)
        *permissions = (*file)->content.record.permissions;
    return file != nullptr;
}
