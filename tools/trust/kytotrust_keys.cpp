// Key files: public keys and trust folders, new key pairs, secret keys (plain or encrypted
// with a password through scrypt).
#include <dirent.h>
#include <errno.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <memory>

#include <sodium.h>

#include "kytotrust.h"
#include "kytotrust_io.h"

namespace kytotrust {

using namespace detail;

namespace {

constexpr size_t kPubLen = 2 + 8 + 32;
constexpr size_t kSealedLen = 8 + 64 + 32;  // id, key, checksum: what a password hides
constexpr size_t kSecLen = 2 + 2 + 2 + 32 + 8 + 8 + kSealedLen;
// Where the fields of a decoded secret key start.
constexpr size_t kKdfAt = 2, kChkAlgAt = 4, kSaltAt = 6, kOpsAt = 38, kMemAt = 46, kSealedAt = 54;
constexpr unsigned long long kMaxMemLimit = 4ULL << 30;  // a key asking for more is refused

uint64_t ReadLE(const uint8_t* p) {
    uint64_t v = 0;
    for (int i = 7; i >= 0; --i)
        v = (v << 8) | p[i];
    return v;
}

void WriteLE(uint8_t* p, uint64_t v) {
    for (int i = 0; i < 8; ++i)
        p[i] = static_cast<uint8_t>(v >> (8 * i));
}

// BLAKE2b-256 of "Ed" || id || key.
void Checksum(const uint8_t id[8], const uint8_t key[64], uint8_t out[32]) {
    crypto_generichash_state st;
    crypto_generichash_init(&st, nullptr, 0, 32);
    crypto_generichash_update(&st, reinterpret_cast<const unsigned char*>("Ed"), 2);
    crypto_generichash_update(&st, id, 8);
    crypto_generichash_update(&st, key, 64);
    crypto_generichash_final(&st, out, 32);
    sodium_memzero(&st, sizeof st);
}

// XORs the sealed part with the scrypt stream of the password.
bool Scrypt(uint8_t* sealed, const std::string& password, const uint8_t salt[32],
            unsigned long long ops, unsigned long long mem, std::string& why) {
    uint8_t stream[kSealedLen];
    Wipe wipe(stream, sizeof stream);
    if (crypto_pwhash_scryptsalsa208sha256(stream, sizeof stream, password.data(), password.size(),
                                           salt, ops, static_cast<size_t>(mem)) != 0) {
        why = "cannot derive the key from the password (out of memory?)";
        return false;
    }
    for (size_t i = 0; i < kSealedLen; ++i)
        sealed[i] ^= stream[i];
    return true;
}

// The single base64 line after the "untrusted comment:" line.
bool PayloadLine(const std::string& text, std::string& line, std::string& why) {
    const std::vector<std::string> lines = Lines(text);
    if (lines.size() < 2 || !StartsWith(lines[0], "untrusted comment: ")) {
        why = "no \"untrusted comment:\" line followed by the key";
        return false;
    }
    for (size_t i = 2; i < lines.size(); ++i) {
        if (!lines[i].empty()) {
            why = "text after the key";
            return false;
        }
    }
    line = lines[1];
    return true;
}

}  // namespace

bool ParsePublicKey(const std::string& text, PublicKey& key, std::string& why) {
    std::string line;
    uint8_t bin[kPubLen];
    if (!PayloadLine(text, line, why))
        return false;
    if (!Unbase64(line, bin, sizeof bin)) {
        why = "the key is not base64 of " + std::to_string(kPubLen) + " bytes";
        return false;
    }
    if (memcmp(bin, "Ed", 2) != 0) {
        why = "not an Ed25519 key";
        return false;
    }
    memcpy(key.id, bin + 2, 8);
    memcpy(key.key, bin + 10, 32);
    key.path.clear();
    return true;
}

bool LoadPublicKey(const std::string& path, PublicKey& key, std::string& why) {
    std::string text;
    if (!ReadSmallFile(path, text, why))
        return false;
    if (!ParsePublicKey(text, key, why)) {
        why = "bad public key " + path + ": " + why;
        return false;
    }
    key.path = path;
    return true;
}

bool LoadTrustFolder(const std::string& dir, std::vector<PublicKey>& keys, std::string& why) {
    std::unique_ptr<DIR, int (*)(DIR*)> d(opendir(dir.c_str()), closedir);  // O_CLOEXEC
    if (!d) {
        why = "cannot read the trust folder " + dir + ": " + strerror(errno);
        return false;
    }
    std::vector<std::string> names;
    while (const dirent* e = readdir(d.get())) {
        const std::string name = e->d_name;
        if (name.size() > 4 && name.compare(name.size() - 4, 4, ".pub") == 0)
            names.push_back(name);
    }
    std::sort(names.begin(), names.end());
    keys.clear();
    std::string skipped;
    for (const std::string& name : names) {
        PublicKey key;
        std::string keyWhy;
        if (LoadPublicKey(dir + "/" + name, key, keyWhy))
            keys.push_back(key);
        else
            skipped += (skipped.empty() ? "skipped " : "; skipped ") + keyWhy;
    }
    if (keys.empty()) {
        why = "no readable key (*.pub) in the trust folder " + dir +
              (skipped.empty() ? "" : ": " + skipped);
        return false;
    }
    why = skipped;
    return true;
}

bool GenerateKeyPair(const std::string& pubPath, const std::string& secPath,
                     const std::string& password, std::string& why) {
    if (!SodiumReady(why))
        return false;
    for (const std::string& p : {pubPath, secPath}) {
        struct stat st;
        if (lstat(p.c_str(), &st) == 0) {
            why = p + " exists already: not overwritten";
            return false;
        }
    }
    uint8_t pub[32], sec[kSecLen] = {0};
    Wipe wipe(sec, sizeof sec);
    uint8_t* const sealed = sec + kSealedAt;  // id, key, checksum
    memcpy(sec, "Ed", 2);
    memcpy(sec + kChkAlgAt, "B2", 2);
    crypto_sign_keypair(pub, sealed + 8);
    randombytes_buf(sealed, 8);
    Checksum(sealed, sealed + 8, sealed + 72);

    uint8_t pubBin[kPubLen];
    memcpy(pubBin, "Ed", 2);
    memcpy(pubBin + 2, sealed, 8);
    memcpy(pubBin + 10, pub, 32);
    const std::string id = KeyIdHex(sealed);
    const std::string pubText =
        "untrusted comment: public key " + id + "\n" + Base64(pubBin, sizeof pubBin) + "\n";
    if (!password.empty()) {
        memcpy(sec + kKdfAt, "Sc", 2);
        randombytes_buf(sec + kSaltAt, 32);
        const unsigned long long ops = crypto_pwhash_scryptsalsa208sha256_OPSLIMIT_SENSITIVE;
        const unsigned long long mem = crypto_pwhash_scryptsalsa208sha256_MEMLIMIT_SENSITIVE;
        WriteLE(sec + kOpsAt, ops);
        WriteLE(sec + kMemAt, mem);
        if (!Scrypt(sealed, password, sec + kSaltAt, ops, mem, why))
            return false;
    }
    std::string secText = std::string("untrusted comment: ") +
                          (password.empty() ? "" : "encrypted ") + "secret key " + id + "\n" +
                          Base64(sec, sizeof sec) + "\n";
    Wipe wipeText(&secText[0], secText.size());
    if (!WriteBeside(secPath, secText, 0600, true, why))
        return false;
    if (!WriteBeside(pubPath, pubText, 0644, true, why)) {
        unlink(secPath.c_str());  // ours: written just now
        return false;
    }
    return true;
}

namespace {

// Checks the decoded (and decrypted) key: checksum, and the public half the key carries
// against the one its seed makes.
bool CheckSecret(const uint8_t* sec, bool encrypted, std::string& why) {
    const uint8_t* const sealed = sec + kSealedAt;
    uint8_t sum[32], zero[32] = {0};
    Checksum(sealed, sealed + 8, sum);
    // A plain key as the common tool writes it carries no checksum (32 zero bytes).
    const bool noSum = !encrypted && sodium_memcmp(sealed + 72, zero, 32) == 0;
    if (!noSum && sodium_memcmp(sum, sealed + 72, 32) != 0) {
        why = encrypted ? "wrong password (the secret key's checksum does not match)"
                        : "the secret key's checksum does not match: the file is damaged";
        return false;
    }
    uint8_t pub[32], again[64];
    Wipe wipe(again, sizeof again);
    crypto_sign_seed_keypair(pub, again, sealed + 8);
    if (sodium_memcmp(again, sealed + 8, 64) != 0) {
        why = "the secret key is damaged (its halves do not match)";
        return false;
    }
    return true;
}

}  // namespace

bool LoadSecretKey(const std::string& path, const std::string& password, SecretKey& key,
                   std::string& why) {
    if (!SodiumReady(why))
        return false;
    std::string text, line;
    if (!ReadSmallFile(path, text, why))
        return false;
    Wipe wipeText(&text[0], text.size());
    uint8_t sec[kSecLen];
    Wipe wipe(sec, sizeof sec);
    if (!PayloadLine(text, line, why)) {
        why = "bad secret key " + path + ": " + why;
        return false;
    }
    Wipe wipeLine(&line[0], line.size());
    if (!Unbase64(line, sec, sizeof sec) || memcmp(sec, "Ed", 2) != 0 ||
        memcmp(sec + kChkAlgAt, "B2", 2) != 0) {
        why = "bad secret key " + path + ": not base64 of an Ed25519 key with a BLAKE2b checksum";
        return false;
    }
    const bool encrypted = memcmp(sec + kKdfAt, "Sc", 2) == 0;
    if (!encrypted && memcmp(sec + kKdfAt, "\0\0", 2) != 0) {
        why = "secret key " + path + ": unknown key derivation";
        return false;
    }
    if (encrypted) {
        const unsigned long long mem = ReadLE(sec + kMemAt);
        if (mem > kMaxMemLimit) {
            why = "secret key " + path + ": asks for too much memory to decrypt";
            return false;
        }
        if (!Scrypt(sec + kSealedAt, password, sec + kSaltAt, ReadLE(sec + kOpsAt), mem, why))
            return false;
    }
    if (!CheckSecret(sec, encrypted, why)) {
        why = "secret key " + path + ": " + why;
        return false;
    }
    memcpy(key.id, sec + kSealedAt, 8);
    memcpy(key.key, sec + kSealedAt + 8, 64);
    return true;
}

}  // namespace kytotrust
