// Signing: the file's BLAKE2b-512 hash, streamed, signed with Ed25519; then the trusted
// comment signed together with that signature.
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include <sodium.h>

#include "kytotrust.h"
#include "kytotrust_io.h"
#include "scoped.h"

namespace kytotrust {

using namespace detail;

bool detail::HashFile(const std::string& path, uint8_t hash[64], std::string& why) {
    kyto::UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY));
    if (!fd.valid()) {
        why = "cannot read " + path + ": " + strerror(errno);
        return false;
    }
    crypto_generichash_state st;
    crypto_generichash_init(&st, nullptr, 0, 64);
    static constexpr size_t kBlock = 1 << 16;
    std::string buf(kBlock, '\0');
    for (;;) {
        const ssize_t n = kyto::ReadRetry(fd.get(), &buf[0], kBlock);
        if (n < 0) {
            why = "cannot read " + path + ": " + strerror(errno);
            return false;
        }
        if (n == 0)
            break;
        crypto_generichash_update(&st, reinterpret_cast<const unsigned char*>(buf.data()),
                                  static_cast<unsigned long long>(n));
    }
    crypto_generichash_final(&st, hash, 64);
    return true;
}

bool SignFile(const SecretKey& key, const std::string& filePath, const std::string& signedName,
              std::string& sigText, std::string& why) {
    if (!SodiumReady(why))
        return false;
    if (signedName.empty() || signedName.find_first_of("\t\r\n") != std::string::npos) {
        why = "cannot sign under the name \"" + signedName + "\": empty or with a tab or newline";
        return false;
    }
    uint8_t hash[64];
    if (!HashFile(filePath, hash, why))
        return false;
    // "ED" || id || signature of the hash
    uint8_t sig[2 + 8 + 64];
    memcpy(sig, "ED", 2);
    memcpy(sig + 2, key.id, 8);
    crypto_sign_detached(sig + 10, nullptr, hash, sizeof hash, key.key);

    const std::string comment =
        "timestamp:" + std::to_string(static_cast<long long>(time(nullptr))) +
        "\tfile:" + signedName + "\thashed";
    std::string signedPart(reinterpret_cast<const char*>(sig + 10), 64);
    signedPart += comment;
    uint8_t global[64];
    crypto_sign_detached(global, nullptr, reinterpret_cast<const unsigned char*>(signedPart.data()),
                         signedPart.size(), key.key);
    sigText = "untrusted comment: signature from key " + KeyIdHex(key.id) + "\n" +
              Base64(sig, sizeof sig) + "\ntrusted comment: " + comment + "\n" +
              Base64(global, sizeof global) + "\n";
    return true;
}

bool WriteSignature(const std::string& filePath, const std::string& sigText, std::string& why) {
    return WriteBeside(filePath + ".minisig", sigText, 0644, false, why);
}

}  // namespace kytotrust
