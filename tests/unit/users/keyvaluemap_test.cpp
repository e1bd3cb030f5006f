#include "users/keyvaluemap.h"

#include <gtest/gtest.h>

#include <climits>
#include <cstring>
#include <functional>
#include <string>
#include <vector>

using namespace std::string_literals;

namespace {

// A buffer with a guard behind it.
class Buffer {
public:
    explicit Buffer(std::size_t size, const std::string& text = "") : m_size(size), m_bytes(size + GUARD, '#') {
        std::memcpy(m_bytes.data(), text.c_str(), text.size() + 1);
    }
    char* Data() { return m_bytes.data(); }
    std::size_t Size() const { return m_size; }
    std::string Text() const { return m_bytes.data(); }
    bool IsGuardWhole() const {
        return std::string(m_bytes.begin() + static_cast<std::ptrdiff_t>(m_size), m_bytes.end()) ==
               std::string(GUARD, '#');
    }

private:
    static constexpr std::size_t GUARD = 64;
    std::size_t m_size;
    std::vector<char> m_bytes;
};

}  // namespace

TEST(KeyValueMap, TheFormatsOfThePairs) {
    EXPECT_STREQ("%s=%s", KeyValueMap::PSZ_PARAM_SZ_VAL_FORMAT);
    EXPECT_STREQ("&%s=%s", KeyValueMap::PSZ_NEXT_PARAM_SZ_VAL_FORMAT);
    EXPECT_STREQ("%s=%d", KeyValueMap::PSZ_PARAM_INT_VAL_FORMAT);
    EXPECT_STREQ("&%s=%d", KeyValueMap::PSZ_NEXT_PARAM_INT_VAL_FORMAT);
    EXPECT_STREQ("%s%d=%s", KeyValueMap::PSZ_PARAM_SZ_VAL_COUNT_FORMAT);
    EXPECT_STREQ("&%s%d=%s", KeyValueMap::PSZ_NEXT_PARAM_SZ_VAL_COUNT_FORMAT);
    EXPECT_STREQ("%s%d=%d", KeyValueMap::PSZ_PARAM_INT_VAL_COUNT_FORMAT);
    EXPECT_STREQ("&%s%d=%d", KeyValueMap::PSZ_NEXT_PARAM_INT_VAL_COUNT_FORMAT);
    EXPECT_EQ("", KeyValueMap::S_NULL_STRING);
}

TEST(KeyValueMap, AddsEveryFormOfPair) {
    struct Case {
        std::function<void(KeyValueMap&)> add;
        const char* pair;
    };
    const std::string key = "key";
    const std::vector<Case> cases = {
        {[](KeyValueMap& m) { m.Add("name", "value"); }, "name=value"},
        {[](KeyValueMap& m) { m.Add("name", ""); }, "name="},
        {[](KeyValueMap& m) { m.Add("", "value"); }, "=value"},
        {[](KeyValueMap& m) { m.Add("n", 42, 10); }, "n=42"},
        {[](KeyValueMap& m) { m.Add("n", 0, 10); }, "n=0"},
        {[](KeyValueMap& m) { m.Add("n", -42, 10); }, "n=-42"},
        {[](KeyValueMap& m) { m.Add("n", 255, 16); }, "n=ff"},
        {[](KeyValueMap& m) { m.Add("n", -255, 16); }, "n=-ff"},
        {[](KeyValueMap& m) { m.Add("n", 5, 2); }, "n=101"},
        {[](KeyValueMap& m) { m.Add("n", 8, 8); }, "n=10"},
        {[](KeyValueMap& m) { m.Add("n", 35, 36); }, "n=z"},
        {[](KeyValueMap& m) { m.Add("n", INT_MAX, 10); }, "n=2147483647"},
        {[](KeyValueMap& m) { m.Add("n", INT_MIN, 10); }, "n=-2147483648"},
        {[](KeyValueMap& m) { m.Add("n", INT_MIN, 16); }, "n=-80000000"},
        {[](KeyValueMap& m) { m.Add("User", 3, "x"); }, "User3=x"},
        {[](KeyValueMap& m) { m.Add("User", -3, "x"); }, "User-3=x"},
        {[](KeyValueMap& m) { m.Add("p", 2, 31, 16); }, "p2=1f"},
        {[](KeyValueMap& m) { m.Add("p", 12, 7, 10); }, "p12=7"},
        {[&](KeyValueMap& m) { m.Add(key, "value"); }, "key=value"},
        {[&](KeyValueMap& m) { m.Add(key, 26, 16); }, "key=1a"},
        {[&](KeyValueMap& m) { m.Add(key, 3, "x"); }, "key3=x"},
        {[&](KeyValueMap& m) { m.Add(key, 16, 16, 16); }, "key16=10"},
        {[](KeyValueMap& m) { m.Add("100%", "%s%n"); }, "100%=%s%n"},
        {[](KeyValueMap& m) { m.Add("a&b=c", "d&e=f"); }, "a&b=c=d&e=f"},
        {[](KeyValueMap& m) { m.Add(static_cast<const char*>(nullptr), static_cast<const char*>(nullptr)); }, "="},
        {[](KeyValueMap& m) { m.Add("key\0more"s, "value"); }, "key=value"},
    };
    for (const Case& c : cases) {
        KeyValueMap map;
        EXPECT_EQ("", map.Text());
        c.add(map);
        EXPECT_EQ(c.pair, map.Text()) << "the first pair";
        c.add(map);
        EXPECT_EQ(c.pair + "&"s + c.pair, map.Text()) << "later pairs";
    }
}

TEST(KeyValueMap, PairsFollowInTheOrderOfTheirAdding) {
    KeyValueMap map;
    map.Add("name", "value");
    map.Add("name2", "value2");
    map.Add("name", 1, 10);
    EXPECT_EQ("name=value&name2=value2&name=1", map.Text());
}

TEST(KeyValueMap, CopiesAreIndependent) {
    KeyValueMap one;
    one.Add("a", "1");
    KeyValueMap two = one;
    two.Add("b", "2");
    EXPECT_EQ("a=1", one.Text());
    EXPECT_EQ("a=1&b=2", two.Text());
}

TEST(KeyValueMap, AppendsEveryFormOfPairToABuffer) {
    struct Case {
        std::function<int(char*, std::size_t)> append;
        std::string pair;
    };
    const std::string longText(300, 'v');
    const std::vector<Case> cases = {
        {[](char* b, std::size_t s) { return KeyValueMap::Append(b, s, "name", "value"); }, "name=value"},
        {[](char* b, std::size_t s) { return KeyValueMap::Append(b, s, "", ""); }, "="},
        {[](char* b, std::size_t s) { return KeyValueMap::Append(b, s, "n", 42); }, "n=42"},
        {[](char* b, std::size_t s) { return KeyValueMap::Append(b, s, "n", INT_MIN); }, "n=-2147483648"},
        {[](char* b, std::size_t s) { return KeyValueMap::Append(b, s, "u", 7, "alice"); }, "u7=alice"},
        {[](char* b, std::size_t s) { return KeyValueMap::Append(b, s, "p", 7, -1); }, "p7=-1"},
        {[](char* b, std::size_t s) { return KeyValueMap::Append(b, s, "%s%n", "%d"); }, "%s%n=%d"},
        {[](char* b, std::size_t s) { return KeyValueMap::Append(b, s, nullptr, static_cast<const char*>(nullptr)); },
         "="},
        {[&](char* b, std::size_t s) { return KeyValueMap::Append(b, s, "k", longText.c_str()); }, "k=" + longText},
    };
    for (const Case& c : cases) {
        for (const std::string& before : {""s, "a=1"s, "x"s}) {
            const std::string after = before + (before.empty() ? "" : "&") + c.pair;
            const std::size_t exact = after.size() + 1;
            for (const std::size_t size : {exact, exact + 1, exact + 1000}) {
                Buffer buffer(size, before);
                EXPECT_EQ(static_cast<int>(after.size() - before.size()), c.append(buffer.Data(), size));
                EXPECT_EQ(after, buffer.Text());
                EXPECT_TRUE(buffer.IsGuardWhole());
            }
            for (std::size_t size = before.size() + 1; size < exact; ++size) {
                Buffer buffer(size, before);
                EXPECT_EQ(0, c.append(buffer.Data(), size)) << "no room for all of it";
                EXPECT_EQ(before, buffer.Text());
                EXPECT_TRUE(buffer.IsGuardWhole());
            }
        }
    }
}

TEST(KeyValueMap, ABufferWithoutAnEndOrWithoutRoomIsLeftAlone) {
    std::vector<char> full(8, 'x');
    EXPECT_EQ(0, KeyValueMap::Append(full.data(), full.size(), "k", "v"));
    EXPECT_EQ(std::vector<char>(8, 'x'), full);
    char byte = 'x';
    EXPECT_EQ(0, KeyValueMap::Append(&byte, 0, "k", "v"));
    EXPECT_EQ('x', byte);
    EXPECT_EQ(0, KeyValueMap::Append(nullptr, 0, "k", 1));
}
