// Sealing of stored passwords under the key of the installation, and the handling of secrets in memory.
#pragma once

#include <string>
#include <string_view>

// The key: 32 random bytes in a file of its own, mode 0600, made by the first sealing (with the directories above it)
// and never overwritten. Two processes that make it at the same time agree on one. Read once and kept until another
// file is named.
inline constexpr const char* DEFAULT_ENCRYPTION_KEY_FILE = "./oxm_oxx/datfiles/ox_remote.key";
void SetEncryptionKeyFile(const std::string& path);
// The next use reads the file again: it may have been restored.
void ForgetEncryptionKey();

// Seals a text of any bytes. Two sealings of one text differ. The result is made of letters, digits, "-" and "_" only,
// so it can stand in settings files, URLs and key/value texts as it is. False, and an empty text, when there is no key
// and none can be made, or the key file is damaged. Thread-safe.
bool oxEncrypt(std::string_view clear, std::string& sealed);
// False, and an empty text, for everything that `oxEncrypt` did not make under this key. Makes no key. Thread-safe.
bool oxDecrypt(std::string_view sealed, std::string& clear);

// Whether two secrets are the same; the time it takes does not tell where they differ. Thread-safe.
bool EqualSecrets(std::string_view one, std::string_view other);
// Overwrites the text, and what an earlier, longer text left behind its end, and empties it.
void WipeText(std::string& text);
