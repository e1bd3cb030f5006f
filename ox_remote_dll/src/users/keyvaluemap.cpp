#include "users/keyvaluemap.h"

#include <cstdarg>
#include <cstdio>
#include <cstring>

#include "platform/text.h"

const char* const KeyValueMap::PSZ_PARAM_SZ_VAL_FORMAT = "%s=%s";
const char* const KeyValueMap::PSZ_NEXT_PARAM_SZ_VAL_FORMAT = "&%s=%s";
const char* const KeyValueMap::PSZ_PARAM_INT_VAL_FORMAT = "%s=%d";
const char* const KeyValueMap::PSZ_NEXT_PARAM_INT_VAL_FORMAT = "&%s=%d";
const char* const KeyValueMap::PSZ_PARAM_SZ_VAL_COUNT_FORMAT = "%s%d=%s";
const char* const KeyValueMap::PSZ_NEXT_PARAM_SZ_VAL_COUNT_FORMAT = "&%s%d=%s";
const char* const KeyValueMap::PSZ_PARAM_INT_VAL_COUNT_FORMAT = "%s%d=%d";
const char* const KeyValueMap::PSZ_NEXT_PARAM_INT_VAL_COUNT_FORMAT = "&%s%d=%d";
const std::string KeyValueMap::S_NULL_STRING;

namespace {

// Null stands for no text.
const char* OrEmpty(const char* text) {
    return text != nullptr ? text : "";
}

// The formats are those above; nothing from outside is ever one.
int AppendFormatted(char* buffer, std::size_t size, const char* first, const char* next, ...) {
    const std::size_t length = buffer != nullptr ? strnlen(buffer, size) : size;
    if (length >= size)
        return 0;
    const std::size_t room = size - length;
    va_list arguments;
    va_start(arguments, next);
    const int written = std::vsnprintf(buffer + length, room, length == 0 ? first : next, arguments);
    va_end(arguments);
    if (written >= 0 && static_cast<std::size_t>(written) < room)
        return written;
    buffer[length] = '\0';
    return 0;
}

}  // namespace

void KeyValueMap::Add(const char* key, const char* value) {
    AddPair(OrEmpty(key), OrEmpty(value));
}

void KeyValueMap::Add(const char* key, int value, int radix) {
    AddPair(OrEmpty(key), IntToText(value, radix));
}

void KeyValueMap::Add(const char* key, int index, const char* value) {
    AddPair(OrEmpty(key) + IntToText(index), OrEmpty(value));
}

void KeyValueMap::Add(const char* key, int index, int value, int radix) {
    AddPair(OrEmpty(key) + IntToText(index), IntToText(value, radix));
}

// The text is read as a C string, which a NUL inside a key would end: a key ends there itself.
void KeyValueMap::Add(const std::string& key, const char* value) {
    Add(key.c_str(), value);
}

void KeyValueMap::Add(const std::string& key, int value, int radix) {
    Add(key.c_str(), value, radix);
}

void KeyValueMap::Add(const std::string& key, int index, const char* value) {
    Add(key.c_str(), index, value);
}

void KeyValueMap::Add(const std::string& key, int index, int value, int radix) {
    Add(key.c_str(), index, value, radix);
}

int KeyValueMap::Append(char* buffer, std::size_t size, const char* key, const char* value) {
    return AppendFormatted(buffer, size, PSZ_PARAM_SZ_VAL_FORMAT, PSZ_NEXT_PARAM_SZ_VAL_FORMAT, OrEmpty(key),
                           OrEmpty(value));
}

int KeyValueMap::Append(char* buffer, std::size_t size, const char* key, int value) {
    return AppendFormatted(buffer, size, PSZ_PARAM_INT_VAL_FORMAT, PSZ_NEXT_PARAM_INT_VAL_FORMAT, OrEmpty(key), value);
}

int KeyValueMap::Append(char* buffer, std::size_t size, const char* key, int index, const char* value) {
    return AppendFormatted(buffer, size, PSZ_PARAM_SZ_VAL_COUNT_FORMAT, PSZ_NEXT_PARAM_SZ_VAL_COUNT_FORMAT,
                           OrEmpty(key), index, OrEmpty(value));
}

int KeyValueMap::Append(char* buffer, std::size_t size, const char* key, int index, int value) {
    return AppendFormatted(buffer, size, PSZ_PARAM_INT_VAL_COUNT_FORMAT, PSZ_NEXT_PARAM_INT_VAL_COUNT_FORMAT,
                           OrEmpty(key), index, value);
}

void KeyValueMap::AddPair(const std::string& key, const std::string& value) {
    if (!m_text.empty())
        m_text += '&';
    m_text.append(key).append(1, '=').append(value);
}
