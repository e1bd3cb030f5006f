#include "net/socketaddress.h"

#include <arpa/inet.h>
#include <netdb.h>

#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "net/support_table.h"

namespace {
int s_hostLookUps = 0;
std::string s_lookedUp;
int s_addressFamily = 0;
socklen_t s_addressLength = 0;
std::string s_addressBytes;

hostent* FindNoHost(const char* name) {
    ++s_hostLookUps;
    s_lookedUp = name;
    return nullptr;
}

// Finds 192.0.2.7 first and 192.0.2.8 second.
hostent* FindTwoAddresses(const char* name) {
    ++s_hostLookUps;
    s_lookedUp = name;
    static char first[] = "\xc0\x00\x02\x07";
    static char second[] = "\xc0\x00\x02\x08";
    static char* list[] = {first, second, nullptr};
    static hostent entry{};
    entry.h_addrtype = AF_INET;
    entry.h_length = 4;
    entry.h_addr_list = list;
    return &entry;
}

hostent* FindOtherFamily(const char* name) {
    hostent* entry = FindTwoAddresses(name);
    entry->h_addrtype = AF_INET6;
    return entry;
}

// An entry of an address kind that is longer than the place for it.
hostent* FindLongAddress(const char* name) {
    hostent* entry = FindTwoAddresses(name);
    static char bytes[] = "0123456789abcdef";
    static char* list[] = {bytes, nullptr};
    entry->h_length = 16;
    entry->h_addr_list = list;
    return entry;
}

hostent* FindShortAddress(const char* name) {
    hostent* entry = FindTwoAddresses(name);
    entry->h_length = 2;
    return entry;
}

hostent* FindEmptyList(const char* name) {
    hostent* entry = FindTwoAddresses(name);
    static char* list[] = {nullptr};
    entry->h_addr_list = list;
    return entry;
}

hostent* NameByAddress(const void* address, socklen_t length, int family) {
    s_addressBytes.assign(static_cast<const char*>(address), length);
    s_addressLength = length;
    s_addressFamily = family;
    static char name[] = "some.example";
    static hostent entry{};
    entry.h_name = name;
    return &entry;
}

hostent* NoNameByAddress(const void*, socklen_t, int) {
    return nullptr;
}

hostent* EntryWithoutName(const void*, socklen_t, int) {
    static hostent entry{};
    entry.h_name = nullptr;
    return &entry;
}

servent* FindService(const char* service, const char* protocol) {
    static servent entry{};
    entry.s_port = htons(std::string(service) == "http" && std::string(protocol) == "tcp" ? 80 : 81);
    return &entry;
}

servent* FindNoService(const char*, const char*) {
    return nullptr;
}

// Writes the address byte by byte into the one place that all look-ups share, as the C library does.
hostent* FindByNumber(const char* name) {
    static char bytes[4];
    static char* list[] = {bytes, nullptr};
    static hostent entry{};
    std::memcpy(bytes, "\x0a\x00\x00", 3);
    bytes[3] = 0;
    std::this_thread::yield();
    bytes[3] = static_cast<char>(std::stoi(name + 1));
    entry.h_addrtype = AF_INET;
    entry.h_length = 4;
    entry.h_addr_list = list;
    return &entry;
}

hostent* NameByNumber(const void* address, socklen_t, int) {
    static char name[16];
    static hostent entry{};
    name[0] = '\0';
    std::this_thread::yield();
    std::snprintf(name, sizeof name, "h%d", static_cast<const unsigned char*>(address)[3]);
    entry.h_name = name;
    return &entry;
}

class OxSockAddr : public TableTest {
protected:
    OxSockAddr() {
        s_hostLookUps = 0;
        s_lookedUp.clear();
    }
};
}  // namespace

TEST_F(OxSockAddr, IsTheSixteenBytesInNetworkOrder) {
    const oxSockAddr address(0x01020304, 0x1122, AF_INET);
    unsigned char expected[16] = {0, 0, 0x11, 0x22, 1, 2, 3, 4};
    const sa_family_t family = AF_INET;
    std::memcpy(expected, &family, sizeof family);
    EXPECT_EQ(0, std::memcmp(address.Raw(), expected, sizeof expected));
    const oxSockAddr copy = address;
    EXPECT_EQ(0, std::memcmp(copy.Raw(), expected, sizeof expected));
}

TEST_F(OxSockAddr, FromNumbersKeepsHostOrderOutside) {
    const oxSockAddr address(LOOPBACK, 8080, AF_INET6);
    EXPECT_EQ(LOOPBACK, address.Address());
    EXPECT_EQ(8080, address.Port());
    EXPECT_EQ(AF_INET6, address.Family());
    EXPECT_EQ("127.0.0.1", address.Dotted());
    const oxSockAddr none;
    EXPECT_EQ(0u, none.Address());
    EXPECT_EQ(0, none.Port());
    EXPECT_EQ(AF_INET, none.Family());
}

TEST_F(OxSockAddr, ServiceGivesThePortAndAnUnknownOneLeavesIt) {
    oxSocket::m_lpfngetservbyname = FindService;
    const oxSockAddr known(LOOPBACK, "http", "tcp");
    EXPECT_EQ(80, known.Port());
    EXPECT_EQ(LOOPBACK, known.Address());
    EXPECT_EQ(AF_INET, known.Family());
    EXPECT_EQ(80, oxSockAddr("10.1.2.3", "http", "tcp").Port());
    oxSocket::m_lpfngetservbyname = FindNoService;
    EXPECT_EQ(0, oxSockAddr(LOOPBACK, "http", "tcp").Port());
    EXPECT_EQ(0, oxSockAddr("10.1.2.3", "http", "tcp").Port());
    EXPECT_EQ(0, oxSockAddr("10.1.2.3", nullptr, nullptr).Port());
}

TEST_F(OxSockAddr, DottedTextIsNotLookedUpButAllOnesIs) {
    static const struct {
        const char* host;
        std::uint32_t address;
        int lookUps;
    } CASES[] = {
        {"127.0.0.1", LOOPBACK, 0},   {"0.0.0.0", 0, 0},
        {"10.1", 0x0a000001, 0},      {"255.255.255.254", 0xfffffffe, 0},
        {"0x7f000001", LOOPBACK, 0},  {"255.255.255.255", 0xffffffff, 1},
        {"256.1.1.1", 0xffffffff, 1}, {"no.such.host", 0xffffffff, 1},
        {"", 0xffffffff, 1},
    };
    oxSocket::m_lpfngethostbyname = FindNoHost;
    for (const auto& c : CASES) {
        s_hostLookUps = 0;
        const oxSockAddr address(c.host, 80);
        EXPECT_EQ(c.address, address.Address()) << c.host;
        EXPECT_EQ(80, address.Port()) << c.host;
        EXPECT_EQ(AF_INET, address.Family()) << c.host;
        EXPECT_EQ(c.lookUps, s_hostLookUps) << c.host;
        if (c.lookUps != 0) {
            EXPECT_EQ(c.host, s_lookedUp);
        }
    }
}

TEST_F(OxSockAddr, NoHostTextIsAllOnesWithoutLookUp) {
    oxSocket::m_lpfngethostbyname = FindNoHost;
    EXPECT_EQ(0xffffffffu, oxSockAddr(static_cast<const char*>(nullptr), 80).Address());
    EXPECT_EQ(0, s_hostLookUps);
}

TEST_F(OxSockAddr, LookUpTakesTheFirstAddressAndTheFamily) {
    oxSocket::m_lpfngethostbyname = FindTwoAddresses;
    EXPECT_EQ("192.0.2.7", oxSockAddr("some.example", 80).Dotted());
    EXPECT_EQ("192.0.2.7", oxSockAddr("255.255.255.255", 80).Dotted());
    oxSocket::m_lpfngethostbyname = FindOtherFamily;
    EXPECT_EQ(AF_INET6, oxSockAddr("some.example", 80).Family());
    oxSocket::m_lpfngethostbyname = FindEmptyList;
    EXPECT_EQ(0xffffffffu, oxSockAddr("some.example", 80).Address());
}

TEST_F(OxSockAddr, LongAddressDoesNotPassItsPlace) {
    oxSocket::m_lpfngethostbyname = FindLongAddress;
    const oxSockAddr address("some.example", 80);
    EXPECT_EQ("48.49.50.51", address.Dotted());
    static const char zeros[8] = {};
    EXPECT_EQ(0, std::memcmp(reinterpret_cast<const char*>(address.Raw()) + 8, zeros, sizeof zeros));
}

TEST_F(OxSockAddr, ShortAddressLeavesTheOtherBytesAllOnes) {
    oxSocket::m_lpfngethostbyname = FindShortAddress;
    EXPECT_EQ("192.0.255.255", oxSockAddr("some.example", 80).Dotted());
}

TEST_F(OxSockAddr, HostNameOfZeroIsUnknownWithoutLookUp) {
    oxSocket::m_lpfngethostbyaddr = NameByAddress;
    s_addressLength = 0;
    EXPECT_STREQ("unknown", oxSockAddr().HostName());
    EXPECT_STREQ("unknown", oxSockAddr(0, 80, AF_INET6).HostName());
    EXPECT_EQ(0u, s_addressLength);
}

TEST_F(OxSockAddr, HostNameIsTheOfficialNameOrEmpty) {
    oxSocket::m_lpfngethostbyaddr = NameByAddress;
    EXPECT_STREQ("some.example", oxSockAddr(0xc0000207, 80, AF_INET).HostName());
    EXPECT_EQ(std::string("\xc0\x00\x02\x07", 4), s_addressBytes);
    EXPECT_EQ(AF_INET, s_addressFamily);
    EXPECT_STREQ("some.example", oxSockAddr(0xc0000207, 80, AF_INET6).HostName());
    EXPECT_EQ(4u, s_addressLength);
    EXPECT_EQ(AF_INET6, s_addressFamily);
    oxSocket::m_lpfngethostbyaddr = NoNameByAddress;
    EXPECT_STREQ("", oxSockAddr(0xc0000207).HostName());
    oxSocket::m_lpfngethostbyaddr = EntryWithoutName;
    EXPECT_STREQ("", oxSockAddr(0xc0000207).HostName());
}

TEST_F(OxSockAddr, ConcurrentLookUpsDoNotMix) {
    oxSocket::m_lpfngethostbyname = FindByNumber;
    oxSocket::m_lpfngethostbyaddr = NameByNumber;
    constexpr int THREADS = 16;
    constexpr int ROUNDS = 200;
    std::vector<int> wrong(THREADS, 0);
    std::vector<std::thread> threads;
    for (int number = 1; number <= THREADS; ++number)
        threads.emplace_back([number, &wrong] {
            const std::string name = "h" + std::to_string(number);
            for (int round = 0; round < ROUNDS; ++round) {
                const oxSockAddr address(name.c_str(), 80);
                if (address.Address() != 0x0a000000u + static_cast<unsigned>(number) || address.HostName() != name)
                    ++wrong[static_cast<std::size_t>(number - 1)];
            }
        });
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(std::vector<int>(THREADS, 0), wrong);
}
