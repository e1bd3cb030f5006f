// A shared library loaded at run time.
#pragma once

#include <string>

// Loaded with all symbols resolved at once and none offered to other libraries; unloaded by the destructor.
class oxSharedLib {
public:
    oxSharedLib() = default;
    ~oxSharedLib() { Close(); }
    oxSharedLib(const oxSharedLib&) = delete;
    oxSharedLib& operator=(const oxSharedLib&) = delete;

    // False when it does not load; `ErrorText` has the loader's reason.
    bool Open(const std::string& name);
    void Close();
    bool IsOpen() const { return m_handle != nullptr; }
    // Null when the library has no such symbol.
    void* Symbol(const char* name) const;
    const std::string& ErrorText() const { return m_errorText; }

private:
    void* m_handle = nullptr;
    std::string m_errorText;
};
