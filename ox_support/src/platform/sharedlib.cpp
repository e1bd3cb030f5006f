#include "platform/sharedlib.h"

#include <dlfcn.h>

#include <utility>

bool oxSharedLib::Open(const std::string& name) {
    Close();
    m_errorText.clear();
    // The loader takes the empty name for the program itself.
    if (name.empty()) {
        m_errorText = "no library name";
        return false;
    }
    m_handle = dlopen(name.c_str(), RTLD_NOW | RTLD_LOCAL);
    if (m_handle != nullptr)
        return true;
    const char* reason = dlerror();
    m_errorText = reason != nullptr ? reason : "unknown loader error";
    return false;
}

void oxSharedLib::Close() {
    if (void* handle = std::exchange(m_handle, nullptr))
        dlclose(handle);
}

void* oxSharedLib::Symbol(const char* name) const {
    return m_handle != nullptr ? dlsym(m_handle, name) : nullptr;
}
