// Shared by the parts of kytotrust: small files, base64 and the two-line blocks
// the key and signature files are made of.
#ifndef KYTOTRUST_IO_H
#define KYTOTRUST_IO_H

#include <stddef.h>
#include <stdint.h>

#include <string>
#include <vector>

namespace kytotrust {
namespace detail {

// Wipes a buffer when it goes away.
class Wipe {
  public:
    Wipe(void* p, size_t n) : p_(p), n_(n) {}
    Wipe(const Wipe&) = delete;
    Wipe& operator=(const Wipe&) = delete;
    ~Wipe();

  private:
    void* p_;
    size_t n_;
};

constexpr size_t kMaxSmallFile = 16384;  // key and signature files are a few lines

bool SodiumReady(std::string& why);
// Reads a small regular file whole; errnoOut gets the failure's errno (0 for "too large").
bool ReadSmallFile(const std::string& path, std::string& text, std::string& why,
                   int* errnoOut = nullptr);
// Writes text to a temporary file beside path with the mode, then moves it to path:
// replacing an old file, or (noReplace) refusing when path exists.
bool WriteBeside(const std::string& path, const std::string& text, unsigned mode, bool noReplace,
                 std::string& why);

std::string Base64(const uint8_t* bin, size_t len);
// Decodes exactly `len` bytes (original base64 with padding, nothing else on the line).
bool Unbase64(const std::string& text, uint8_t* bin, size_t len);
// The file's lines without their "\n" (and a "\r" before it); a last empty line dropped.
std::vector<std::string> Lines(const std::string& text);
bool StartsWith(const std::string& s, const char* prefix);

// The BLAKE2b-512 hash of a file, read in blocks (kytotrust_sign.cpp).
bool HashFile(const std::string& path, uint8_t hash[64], std::string& why);

}  // namespace detail
}  // namespace kytotrust

#endif
