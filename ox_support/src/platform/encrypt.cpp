#include "platform/encrypt.h"

#include <fcntl.h>
#include <sodium.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <mutex>
#include <optional>
#include <vector>

#include "platform/directory.h"
#include "platform/file.h"
#include "platform/filename.h"
#include "platform/mutex.h"

namespace {

constexpr char VERSION = 'a';  // XChaCha20-Poly1305: the nonce, the enciphered text and its tag; covered by the tag
constexpr std::string_view ALPHABET = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789-_";
constexpr std::size_t KEY_BYTES = crypto_aead_xchacha20poly1305_ietf_KEYBYTES;
constexpr std::size_t NONCE_BYTES = crypto_aead_xchacha20poly1305_ietf_NPUBBYTES;
constexpr std::size_t TAG_BYTES = crypto_aead_xchacha20poly1305_ietf_ABYTES;
constexpr std::size_t DIGEST_BYTES = crypto_generichash_BYTES;
constexpr int TEXT_VARIANT = sodium_base64_VARIANT_URLSAFE_NO_PADDING;
static_assert(KEY_BYTES == 32);

// Bytes that are overwritten when they are no longer needed.
template <typename Bytes>
struct Wiped : Bytes {
    Wiped() = default;
    Wiped(const Wiped&) = default;
    Wiped& operator=(const Wiped&) = default;
    ~Wiped() { sodium_memzero(this->data(), this->size()); }
};
using Key = Wiped<std::array<unsigned char, KEY_BYTES>>;
using Digest = Wiped<std::array<unsigned char, DIGEST_BYTES>>;

struct State {
    MMutex mutex;
    std::string path = DEFAULT_ENCRYPTION_KEY_FILE;
    std::optional<Key> key;
};

State& TheState() {
    // Not destroyed: threads may decipher while the process exits.
    static State* const state = new State;
    return *state;
}

bool IsReady() {
    static const bool ready = sodium_init() >= 0;
    return ready;
}

const unsigned char* AsBytes(std::string_view text) {
    return reinterpret_cast<const unsigned char*>(text.data());
}

// False with errno; EINVAL when the file does not hold exactly one key.
bool ReadKey(const std::string& path, Key& key) {
    const UniqueFd file = OpenFile(path, O_RDONLY | O_NONBLOCK);
    struct stat status {};
    if (!file || fstat(file.Get(), &status) != 0)
        return false;
    if (!S_ISREG(status.st_mode) || status.st_size != static_cast<off_t>(key.size())) {
        errno = EINVAL;
        return false;
    }
    std::size_t have = 0;
    while (have < key.size()) {
        const ssize_t count = read(file.Get(), key.data() + have, key.size() - have);
        if (count < 0 && errno == EINTR)
            continue;
        if (count <= 0) {
            errno = count == 0 ? EINVAL : errno;
            return false;
        }
        have += static_cast<std::size_t>(count);
    }
    return true;
}

bool WriteToDisk(int descriptor, const Key& key) {
    return WriteAll(descriptor, reinterpret_cast<const char*>(key.data()), key.size()) && fsync(descriptor) == 0;
}

// Gives the file a new key, unless it has come into being meanwhile. The link makes it appear whole and only where
// nothing has the name.
bool MakeKey(const std::string& path) {
    const std::string directory = oxFilename(path).Directory();
    const std::string parent = directory.empty() ? "." : directory;
    if (!CreateDir(parent))
        return false;
    std::string temporary = path + ".tmp-XXXXXX";
    const UniqueFd file(mkostemp(temporary.data(), O_CLOEXEC));
    if (!file)
        return false;
    Key key;
    randombytes_buf(key.data(), key.size());
    const bool linked = WriteToDisk(file.Get(), key) && (link(temporary.c_str(), path.c_str()) == 0 || errno == EEXIST);
    unlink(temporary.c_str());
    if (!linked)
        return false;
    // Before anything is sealed: a key that a crash takes back would take the sealed texts with it.
    const UniqueFd above = OpenFile(parent, O_RDONLY | O_DIRECTORY);
    return above && (fsync(above.Get()) == 0 || errno == EINVAL);
}

enum class WhenMissing { Make, Fail };

std::optional<Key> TheKey(WhenMissing missing) {
    State& state = TheState();
    const std::scoped_lock lock(state.mutex);
    if (!state.key) {
        Key key;
        bool read = ReadKey(state.path, key);
        if (!read && errno == ENOENT && missing == WhenMissing::Make)
            read = MakeKey(state.path) && ReadKey(state.path, key);
        if (read)
            state.key = key;
    }
    return state.key;
}

void Forget(State& state) {
    if (state.key)
        sodium_memzero(state.key->data(), state.key->size());
    state.key.reset();
}

}  // namespace

void SetEncryptionKeyFile(const std::string& path) {
    State& state = TheState();
    const std::scoped_lock lock(state.mutex);
    state.path = path;
    Forget(state);
}

void ForgetEncryptionKey() {
    State& state = TheState();
    const std::scoped_lock lock(state.mutex);
    Forget(state);
}

bool oxEncrypt(std::string_view clear, std::string& sealed) {
    const std::optional<Key> key = IsReady() ? TheKey(WhenMissing::Make) : std::nullopt;
    if (!key) {
        sealed.clear();
        return false;
    }
    std::vector<unsigned char> bytes(NONCE_BYTES + clear.size() + TAG_BYTES);
    unsigned char* const nonce = bytes.data();
    randombytes_buf(nonce, NONCE_BYTES);
    const unsigned char version = VERSION;
    crypto_aead_xchacha20poly1305_ietf_encrypt(nonce + NONCE_BYTES, nullptr, AsBytes(clear), clear.size(), &version, 1,
                                               nullptr, nonce, key->data());
    std::string text(1 + sodium_base64_encoded_len(bytes.size(), TEXT_VARIANT), VERSION);
    sodium_bin2base64(text.data() + 1, text.size() - 1, bytes.data(), bytes.size(), TEXT_VARIANT);
    text.pop_back();  // the NUL
    sealed = std::move(text);
    return true;
}

bool oxDecrypt(std::string_view sealed, std::string& clear) {
    std::string text;
    bool good = false;
    const std::optional<Key> key = IsReady() ? TheKey(WhenMissing::Fail) : std::nullopt;
    // The decoder lets some bytes above 127 pass for letters.
    if (key && sealed.starts_with(VERSION) && sealed.find_first_not_of(ALPHABET) == std::string_view::npos) {
        sealed.remove_prefix(1);
        std::vector<unsigned char> bytes(sealed.size() + 1);  // more than it takes, and never null
        std::size_t size = 0;
        if (sodium_base642bin(bytes.data(), bytes.size(), sealed.data(), sealed.size(), nullptr, &size, nullptr,
                              TEXT_VARIANT) == 0 &&
            size >= NONCE_BYTES + TAG_BYTES) {
            text.resize(size - NONCE_BYTES - TAG_BYTES);
            const unsigned char version = VERSION;
            good = crypto_aead_xchacha20poly1305_ietf_decrypt(reinterpret_cast<unsigned char*>(text.data()), nullptr,
                                                              nullptr, bytes.data() + NONCE_BYTES, size - NONCE_BYTES,
                                                              &version, 1, bytes.data(), key->data()) == 0;
        }
    }
    WipeText(clear);
    if (good)
        clear = text;
    WipeText(text);
    return good;
}

bool EqualSecrets(std::string_view one, std::string_view other) {
    // Digests have one length, so that the comparison is over the same bytes whatever the texts.
    IsReady();  // chooses the digest's code, which must not happen while another thread runs it
    Digest digests[2];
    crypto_generichash(digests[0].data(), DIGEST_BYTES, AsBytes(one), one.size(), nullptr, 0);
    crypto_generichash(digests[1].data(), DIGEST_BYTES, AsBytes(other), other.size(), nullptr, 0);
    return sodium_memcmp(digests[0].data(), digests[1].data(), DIGEST_BYTES) == 0;
}

void WipeText(std::string& text) {
    text.resize(text.capacity());
    sodium_memzero(text.data(), text.size());
    text.clear();
}
