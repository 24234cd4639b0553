// Signatures of published files, for the vendor's publishing tool (signs) and the driver
// (verifies against the keys of a trust folder, /etc/kytoupdate/trusted.d/*.pub).
//
// The files are those of the common Ed25519 signing tool with trusted comments, so a vendor
// may use either that tool or ours:
//   public key  "untrusted comment: ..." line, then base64("Ed" || key id[8] || key[32])
//   secret key  "untrusted comment: ..." line, then base64("Ed" || kdf "Sc" or 0 0 || "B2" ||
//               salt[32] || opslimit[8, LE] || memlimit[8, LE] || id[8] || key[64] ||
//               checksum[32]); with kdf "Sc" the last 104 bytes are XORed with an scrypt
//               stream of the password; checksum = BLAKE2b-256("Ed" || id || key)
//   signature   "untrusted comment: ..." line, base64("ED" || id || Ed25519 signature of the
//               BLAKE2b-512 hash of the file), "trusted comment: <text>" line,
//               base64(Ed25519 signature of (file signature[64] || text))
// Files are always hashed ("ED"): the hash is streamed, so a 1 GiB image is never held in
// memory.  Signatures of the legacy kind ("Ed", the whole file signed as one message) are
// refused with their own reason: checking one would need the whole file in memory.
//
// Every function returns false with a one-line reason in `why` and throws nothing.  All
// cryptography is libsodium's.
#ifndef KYTOTRUST_H
#define KYTOTRUST_H

#include <stdint.h>

#include <string>
#include <vector>

namespace kytotrust {

struct PublicKey {
    uint8_t id[8];
    uint8_t key[32];
    std::string path;  // the file it was read from ("" when parsed from text)
};

// A decrypted secret key; wiped when it goes away, never copied.
struct SecretKey {
    uint8_t id[8] = {0};
    uint8_t key[64] = {0};
    SecretKey() = default;
    SecretKey(const SecretKey&) = delete;
    SecretKey& operator=(const SecretKey&) = delete;
    ~SecretKey();
};

// The parts of a signature file.
struct Signature {
    bool hashed = false;  // "ED"; false: the legacy "Ed"
    uint8_t id[8] = {0};
    uint8_t sig[64] = {0};
    std::string trustedComment;  // without its "trusted comment: " prefix
    uint8_t globalSig[64] = {0};
};

// The key id as the key's comment line shows it: 16 upper-case hex digits, last byte first.
std::string KeyIdHex(const uint8_t id[8]);

// Public keys.  A trust folder is every "*.pub" file in it; keys that cannot be read are
// skipped and named in `why` (which stays empty when every key loaded); a folder without a
// single readable key is an error.
bool ParsePublicKey(const std::string& text, PublicKey& key, std::string& why);
bool LoadPublicKey(const std::string& path, PublicKey& key, std::string& why);
bool LoadTrustFolder(const std::string& dir, std::vector<PublicKey>& keys, std::string& why);

// Writes a new key pair: the secret key (mode 0600) encrypted with the password, or plain
// when the password is empty.  Each file is written beside its name and linked into place;
// an existing file at either path is never overwritten.
bool GenerateKeyPair(const std::string& pubPath, const std::string& secPath,
                     const std::string& password, std::string& why);
// Reads a secret key, decrypting it when it is encrypted (a wrong password shows as a
// checksum mismatch).  The password is ignored for a plain key.
bool LoadSecretKey(const std::string& path, const std::string& password, SecretKey& key,
                   std::string& why);

// The name a published file is signed and checked under: the last part of its address or
// path ("http://h/debs/a_1-5644-s1_all.deb" and "/site/debs/a_1-5644-s1_all.deb" give
// "a_1-5644-s1_all.deb"), so that a signed file served under another name is refused.
std::string SignedName(const std::string& urlOrPath);

// Signs a file under the name it is published as: sigText is the whole signature file, with
// the trusted comment "timestamp:<unix time>\tfile:<signedName>\thashed".
bool SignFile(const SecretKey& key, const std::string& filePath, const std::string& signedName,
              std::string& sigText, std::string& why);
// Writes sigText to "<filePath>.minisig" (beside it, then renamed over any old one).
bool WriteSignature(const std::string& filePath, const std::string& sigText, std::string& why);

bool ParseSignature(const std::string& text, Signature& sig, std::string& why);
// Checks the file against its signature file.  The reasons, each its own first words:
//   "unsigned: ..."                   no signature file, or it cannot be read
//   "malformed signature: ..."        not a signature file
//   "legacy signature: ..."           a whole-file ("Ed") signature
//   "signed by an unknown key ..."    no trusted key has the signature's key id
//   "altered: ..."                    the file is not what was signed
//   "trusted comment altered: ..."    the trusted comment is not what was signed
//   "signed under another name: ..."  the trusted comment's file: is not expectedName
bool VerifyFile(const std::vector<PublicKey>& trusted, const std::string& filePath,
                const std::string& sigPath, const std::string& expectedName, std::string& why);

}  // namespace kytotrust

#endif
