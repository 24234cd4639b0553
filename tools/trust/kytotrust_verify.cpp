// Verifying: the signature file read and taken apart, its key looked up among the trusted
// ones, the file's hash and the trusted comment checked, then the name it was signed under.
#include <errno.h>
#include <string.h>

#include <sodium.h>

#include "kytotrust.h"
#include "kytotrust_io.h"

namespace kytotrust {

std::string SignedName(const std::string& urlOrPath) {
    const size_t slash = urlOrPath.rfind('/');
    return slash == std::string::npos ? urlOrPath : urlOrPath.substr(slash + 1);
}

using namespace detail;

namespace {

// The value of the trusted comment's "file:" field; false when it has none.
bool SignedName(const std::string& comment, std::string& name) {
    size_t start = 0;
    for (;;) {
        const size_t tab = comment.find('\t', start);
        const std::string field = comment.substr(start, tab - start);
        if (StartsWith(field, "file:")) {
            name = field.substr(5);
            return true;
        }
        if (tab == std::string::npos)
            return false;
        start = tab + 1;
    }
}

}  // namespace

bool ParseSignature(const std::string& text, Signature& sig, std::string& why) {
    const std::vector<std::string> lines = Lines(text);
    for (size_t i = 4; i < lines.size(); ++i) {
        if (!lines[i].empty()) {
            why = "text after the fourth line";
            return false;
        }
    }
    if (lines.size() < 4 || !StartsWith(lines[0], "untrusted comment: ") ||
        !StartsWith(lines[2], "trusted comment: ")) {
        why = "not the four lines of a signature file";
        return false;
    }
    uint8_t bin[2 + 8 + 64];
    if (!Unbase64(lines[1], bin, sizeof bin) || !Unbase64(lines[3], sig.globalSig, 64)) {
        why = "a signature line is not base64 of a signature";
        return false;
    }
    if (memcmp(bin, "ED", 2) != 0 && memcmp(bin, "Ed", 2) != 0) {
        why = "not an Ed25519 signature";
        return false;
    }
    sig.hashed = bin[1] == 'D';
    memcpy(sig.id, bin + 2, 8);
    memcpy(sig.sig, bin + 10, 64);
    sig.trustedComment = lines[2].substr(strlen("trusted comment: "));
    return true;
}

bool VerifyFile(const std::vector<PublicKey>& trusted, const std::string& filePath,
                const std::string& sigPath, const std::string& expectedName, std::string& why) {
    if (!SodiumReady(why))
        return false;
    std::string text;
    int err = 0;
    if (!ReadSmallFile(sigPath, text, why, &err)) {
        why = (err == ENOENT ? "unsigned: no signature file " + sigPath
               : err != 0    ? "unsigned: " + why
                             : "malformed signature: " + why);
        return false;
    }
    Signature sig;
    if (!ParseSignature(text, sig, why)) {
        why = "malformed signature: " + sigPath + ": " + why;
        return false;
    }
    if (!sig.hashed) {
        why = "legacy signature: " + sigPath +
              " signs the whole file unhashed, which is not accepted; sign it again";
        return false;
    }
    const PublicKey* key = nullptr;
    for (const PublicKey& k : trusted) {
        if (memcmp(k.id, sig.id, 8) == 0)
            key = &k;
    }
    if (key == nullptr) {
        why = "signed by an unknown key " + KeyIdHex(sig.id) + ": no trusted key has its id";
        return false;
    }
    uint8_t hash[64];
    if (!HashFile(filePath, hash, why))
        return false;
    if (crypto_sign_verify_detached(sig.sig, hash, sizeof hash, key->key) != 0) {
        why = "altered: " + filePath + " is not the file signed by key " + KeyIdHex(sig.id);
        return false;
    }
    std::string signedPart(reinterpret_cast<const char*>(sig.sig), 64);
    signedPart += sig.trustedComment;
    if (crypto_sign_verify_detached(sig.globalSig,
                                    reinterpret_cast<const unsigned char*>(signedPart.data()),
                                    signedPart.size(), key->key) != 0) {
        why = "trusted comment altered: its signature in " + sigPath + " does not match";
        return false;
    }
    std::string name;
    if (!SignedName(sig.trustedComment, name) || name != expectedName) {
        why = "signed under another name: the signature is for \"" +
              (name.empty() ? std::string("(no file name)") : name) + "\", not \"" + expectedName +
              "\"";
        return false;
    }
    return true;
}

}  // namespace kytotrust
