// Settings files.
#pragma once

#include <memory>
#include <string>
#include <string_view>

// An INI-style settings file: `[section]` headers and `key=value` lines.
//
// Sections and keys are matched without regard to case; white space around keys and values is trimmed; a line whose
// first character is `;` or `#` is a comment, and nothing else is (values may hold both); the last of several equal
// keys counts; text before the first section is ignored; CR LF line ends and a UTF-8 byte order mark are accepted. A
// value is one line of any length.
//
// Thread rules: none; one thread uses an object at a time.
class oxConfig {
public:
    oxConfig();
    ~oxConfig();
    oxConfig(oxConfig&&) noexcept;
    oxConfig& operator=(oxConfig&&) noexcept;

    // Loads a file. False when it cannot be read (missing, a directory, no permission, an I/O error) or holds a
    // NUL byte; `ErrorText` then says which.
    bool Open(const std::string& path);
    // Loads a text, as if it stood in a file.
    bool OpenText(std::string_view text);
    void Close();
    bool IsOpen() const;
    const std::string& Path() const;
    const std::string& ErrorText() const;

    // Each gives the default when the section or key is missing. An object that was not loaded has no keys.
    std::string GetText(const char* section, const char* key, const std::string& defaultValue) const;
    // Decimal, or hexadecimal after `0x`, with an optional sign; limited to the range of an int. A text that is no
    // number (nothing but the number may stand there) reads as the default.
    int GetInt(const char* section, const char* key, int defaultValue) const;
    // A non-zero number, `yes`, `true`, `on` in any case are true; any other text is false.
    bool GetBool(const char* section, const char* key, bool defaultValue) const;
    bool HasKey(const char* section, const char* key) const;
    bool HasSection(const char* section) const;

    // Values with line breaks or NUL bytes are refused (false): they would become lines of their own. So are sections
    // and keys that would not be read back as such. White space around the value is trimmed, as it would be when read.
    bool PutText(const char* section, const char* key, const std::string& value);
    bool PutInt(const char* section, const char* key, int value);
    void Remove(const char* section, const char* key);
    // The file's new text, with comments, unknown keys and their order kept. Lines that are neither become comments;
    // equal keys and sections with one name are written once, with the comment above the first.
    std::string Text() const;

private:
    struct Data;
    Data& Own();
    std::unique_ptr<Data> m_data;
};
