// Fuzz target: the readers of signature files and public keys (tools/trust) on arbitrary
// text.  What one of them accepts must read back the same when written out again the way
// the files are made, and a trusted comment is always a single line.
#include <sodium.h>

#include "fuzz_common.h"
#include "kytotrust.h"

namespace {

std::string Bytes(const uint8_t* p, size_t n) {
    return std::string(reinterpret_cast<const char*>(p), n);
}

std::string Line(const std::string& bin) {
    std::string out(sodium_base64_ENCODED_LEN(bin.size(), sodium_base64_VARIANT_ORIGINAL), '\0');
    sodium_bin2base64(&out[0], out.size(), reinterpret_cast<const unsigned char*>(bin.data()),
                      bin.size(), sodium_base64_VARIANT_ORIGINAL);
    return out.c_str() + std::string("\n");
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char*** argv) {
    kytofuzz::RequireSandbox((*argv)[0]);
    return sodium_init() < 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string text = Bytes(data, size);
    std::string why;
    kytotrust::Signature s, t;
    if (kytotrust::ParseSignature(text, s, why)) {
        KYTO_FUZZ_CHECK(s.trustedComment.find('\n') == std::string::npos);
        const std::string out = "untrusted comment: x\n" +
                                Line((s.hashed ? "ED" : "Ed") + Bytes(s.id, 8) + Bytes(s.sig, 64)) +
                                "trusted comment: " + s.trustedComment + "\n" +
                                Line(Bytes(s.globalSig, 64));
        KYTO_FUZZ_CHECK(kytotrust::ParseSignature(out, t, why));
        KYTO_FUZZ_CHECK(t.hashed == s.hashed && t.trustedComment == s.trustedComment);
        KYTO_FUZZ_CHECK(Bytes(t.id, 8) + Bytes(t.sig, 64) + Bytes(t.globalSig, 64) ==
                        Bytes(s.id, 8) + Bytes(s.sig, 64) + Bytes(s.globalSig, 64));
    }
    kytotrust::PublicKey k, l;
    if (kytotrust::ParsePublicKey(text, k, why)) {
        const std::string out =
            "untrusted comment: x\n" + Line("Ed" + Bytes(k.id, 8) + Bytes(k.key, 32));
        KYTO_FUZZ_CHECK(kytotrust::ParsePublicKey(out, l, why));
        KYTO_FUZZ_CHECK(Bytes(k.id, 8) + Bytes(k.key, 32) == Bytes(l.id, 8) + Bytes(l.key, 32));
    }
    return 0;
}
