// The "key=value&key=value" texts that carry user and profile data to scripts.
#pragma once

#include <cstddef>
#include <string>

// Collects pairs in one text. Nothing is escaped: a key or value that holds "&" or "=" changes the meaning of the text,
// so callers keep such values out.
class KeyValueMap {
public:
    static const char* const PSZ_PARAM_SZ_VAL_FORMAT;
    static const char* const PSZ_NEXT_PARAM_SZ_VAL_FORMAT;
    static const char* const PSZ_PARAM_INT_VAL_FORMAT;
    static const char* const PSZ_NEXT_PARAM_INT_VAL_FORMAT;
    static const char* const PSZ_PARAM_SZ_VAL_COUNT_FORMAT;
    static const char* const PSZ_NEXT_PARAM_SZ_VAL_COUNT_FORMAT;
    static const char* const PSZ_PARAM_INT_VAL_COUNT_FORMAT;
    static const char* const PSZ_NEXT_PARAM_INT_VAL_COUNT_FORMAT;
    static const std::string S_NULL_STRING;

    void Add(const char* key, const char* value);
    void Add(const char* key, int value, int radix);
    void Add(const char* key, int index, const char* value);
    void Add(const char* key, int index, int value, int radix);
    void Add(const std::string& key, const char* value);
    void Add(const std::string& key, int value, int radix);
    void Add(const std::string& key, int index, const char* value);
    void Add(const std::string& key, int index, int value, int radix);

    const std::string& Text() const { return m_text; }

    // Append one pair to the NUL-terminated text in a buffer of the given size (its NUL included). The characters
    // written; 0, and the text as it was, when the pair does not fit whole.
    static int Append(char* buffer, std::size_t size, const char* key, const char* value);
    static int Append(char* buffer, std::size_t size, const char* key, int value);
    static int Append(char* buffer, std::size_t size, const char* key, int index, const char* value);
    static int Append(char* buffer, std::size_t size, const char* key, int index, int value);

private:
    void AddPair(const std::string& key, const std::string& value);
    std::string m_text;
};
