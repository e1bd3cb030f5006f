// How the users come from their files.
#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <mutex>
#include <utility>

#include "platform/directory.h"
#include "platform/encrypt.h"
#include "platform/text.h"
#include "support/logtext.h"
#include "users/oxuserbase.h"

using State = oxUserFile::State;

void oxUserBase::Report(const File& file) {
    const oxUserFile::Content& content = file.content;
    const std::string name = LogText(content.record.name);
    switch (content.state) {
        case State::PlaintextTooLong:
            std::fprintf(stderr, "Plaintext password for user %s exceeds max allowable length. (%d)\n", name.c_str(),
                         static_cast<int>(oxUserBase::MAX_PLAINTEXT_PASSWORD));
            std::fprintf(stderr, "User %s will not be used.\n", name.c_str());
            break;
        case State::Undecipherable:
            std::fprintf(stderr, "Password for user %s cannot be deciphered. User %s will not be used.\n", name.c_str(),
                         name.c_str());
            break;
        case State::User:
        case State::NoUser:
            break;
    }
}

bool oxUserBase::Load() {
    const oxUserDirectory::Lock directoryLock(m_directory);
    const std::scoped_lock lock(m_mutex);
    m_directory.RemoveLeftovers(directoryLock);
    return Reload() == 0;
}

int oxUserBase::Reload() {
    // The whole list comes first: files that are rewritten meanwhile would be met twice.
    oxDirIterator names(m_directory.Path(), m_pszUSER_FILE_MASK);
    if (!names.IsValid())
        return names.Error();
    Files files;
    Users users;
    while (const std::string* name = names.Next()) {
        const auto known = m_files.find(*name);
        FilePointer file = Look(*name, known != m_files.end() ? known->second : nullptr);
        if (!file)
            continue;
        if (file->IsUser())
            users.emplace(file->content.record.name, *name);
        files.emplace_hint(files.end(), *name, std::move(file));
    }
    const bool same = IsSame(users, files);
    m_files.swap(files);
    m_users.swap(users);
    if (!same)
        ++m_generation;
    EncipherPlaintexts();
    return 0;
}

// Null for a file that is gone. One that cannot be read is taken as it was.
oxUserBase::FilePointer oxUserBase::Look(const std::string& fileName, const FilePointer& known) {
    const std::string path = m_directory.PathOf(fileName);
    oxFileStamp stamp;
    if (known && !known->readAgain && oxUserFile::ReadStamp(path, stamp) == 0 && stamp == known->stamp)
        return known;
    ++m_filesRead;
    const auto file = std::make_shared<File>();
    file->name = fileName;
    std::string text;
    bool isStampCertain = false;
    const int error = oxUserFile::Read(path, text, file->stamp, isStampCertain);
    if (error == ENOENT)
        return nullptr;
    if (error == EISDIR || error == EINVAL)
        return file;  // nobody's
    if (error != 0)
        return Unread(path, error, known, *file);
    file->content = oxUserFile::Parse(text);
    WipeText(text);
    // The key may come back, and a file that could not be rewritten may become writable, without the file changing.
    file->readAgain = !isStampCertain || file->content.state == State::Undecipherable || file->content.isPlaintext;
    if (!known || known->content != file->content || known->stamp != file->stamp)
        Report(*file);
    return file;
}

// The file as it was before, or nobody's when it was never read. Each reason is told once.
oxUserBase::FilePointer oxUserBase::Unread(const std::string& path, int error, const FilePointer& known,
                                           const File& empty) {
    if (known && known->readError == error)
        return known;
    std::fprintf(stderr, "User file %s cannot be read: %s\n", LogText(path).c_str(), GetLastErrorText(error));
    const auto file = std::make_shared<File>(known ? *known : empty);
    file->readAgain = true;
    file->readError = error;
    return file;
}

// Passwords that were written by hand do not stay readable. Where the file cannot be written the user is taken all the
// same, and the next reload tries again.
void oxUserBase::EncipherPlaintexts() {
    for (auto& [name, file] : m_files) {
        if (!file->IsUser() || !file->content.isPlaintext)
            continue;
        const auto written = std::make_shared<File>(*file);
        written->content.isPlaintext = false;
        written->readAgain = true;
        if (Store(*written))
            file = written;
    }
}

bool oxUserBase::IsSame(const Users& users, const Files& files) const {
    const auto same = [&](const Users::value_type& one, const Users::value_type& other) {
        const FilePointer& left = files.find(one.second)->second;
        const FilePointer& right = m_files.find(other.second)->second;
        return left == right || left->content.record == right->content.record;
    };
    return std::equal(users.begin(), users.end(), m_users.begin(), m_users.end(), same);
}

// Null when there is no such user.
oxUserBase::FilePointer* oxUserBase::Find(const std::string& name) {
    const auto user = m_users.find(name);
    return user != m_users.end() ? &m_files.find(user->second)->second : nullptr;
}

// Also by one that cannot be used: a second file of the name would lose against it once it is mended.
bool oxUserBase::HasFile(const std::string& name) const {
    return std::any_of(m_files.begin(), m_files.end(),
                       [&](const Files::value_type& file) { return file.second->content.record.name == name; });
}

bool oxUserBase::Store(const File& file) {
    if (!m_directory.Create()) {
        std::fputs("Couldn't create user config directory.\n", stderr);
        return false;
    }
    std::string before;
    std::string after;
    oxFileStamp stamp;
    bool isStampCertain = false;
    const int error = oxUserFile::Read(m_directory.PathOf(file.name), before, stamp, isStampCertain);
    if (error != 0 && error != ENOENT)
        return false;
    const bool composed = oxUserFile::Compose(before, file.content.record, after);
    WipeText(before);  // may hold the password in clear
    return composed && m_directory.Replace(file.name, after);
}
