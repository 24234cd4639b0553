// RAII owners for C resources, shared by the platform layer, the library and the programs
// built in this tree, so that no early return leaks a descriptor, a FILE*, a pipe, a
// temporary file or a platform allocation, and no child is left unreaped.  Header only;
// it uses nothing but the C library and the platform's public calls (the platform layer
// must not depend on the library).  Internal: found through the build tree's include path,
// never installed.
#ifndef KYTO_SCOPED_H
#define KYTO_SCOPED_H

#include <errno.h>
#include <stdio.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <memory>
#include <string>
#include <utility>

#include <kytoplatform/klibc.h>
#include <kytoplatform/kyto_system.h>

// Each shared object keeps its own copy; none of these is part of an exported interface.
#pragma GCC visibility push(hidden)
namespace kyto {

// Owns a file descriptor.
class UniqueFd {
  public:
    UniqueFd() = default;
    explicit UniqueFd(int fd) : fd_(fd) {}
    ~UniqueFd() { reset(); }
    UniqueFd(UniqueFd&& o) noexcept : fd_(o.release()) {}
    UniqueFd& operator=(UniqueFd&& o) noexcept {
        if (this != &o)
            reset(o.release());
        return *this;
    }
    UniqueFd(const UniqueFd&) = delete;
    UniqueFd& operator=(const UniqueFd&) = delete;

    int get() const { return fd_; }
    bool valid() const { return fd_ >= 0; }
    int release() { return std::exchange(fd_, -1); }
    void reset(int fd = -1) {
        if (fd_ >= 0)
            ::close(fd_);
        fd_ = fd;
    }

  private:
    int fd_ = -1;
};

// Owns a FILE* opened with fopen/fdopen (closed with fclose) or popen (closed with pclose).
class UniqueFile {
  public:
    enum Kind { kFopen, kPopen };
    UniqueFile() = default;
    explicit UniqueFile(FILE* f, Kind kind = kFopen) : f_(f), kind_(kind) {}
    ~UniqueFile() { close(); }
    UniqueFile(const UniqueFile&) = delete;
    UniqueFile& operator=(const UniqueFile&) = delete;

    FILE* get() const { return f_; }
    explicit operator bool() const { return f_ != nullptr; }
    // Closes now; returns fclose's or pclose's result (-1 when nothing was open).
    int close() {
        if (!f_)
            return -1;
        FILE* f = std::exchange(f_, nullptr);
        return kind_ == kPopen ? ::pclose(f) : ::fclose(f);
    }

  private:
    FILE* f_ = nullptr;
    Kind kind_ = kFopen;
};

// Unlinks a path when it goes out of scope, unless released.
class ScopedUnlink {
  public:
    explicit ScopedUnlink(std::string path) : path_(std::move(path)) {}
    ~ScopedUnlink() {
        if (!path_.empty())
            ::unlink(path_.c_str());
    }
    ScopedUnlink(const ScopedUnlink&) = delete;
    ScopedUnlink& operator=(const ScopedUnlink&) = delete;
    void release() { path_.clear(); }
    const std::string& path() const { return path_; }

  private:
    std::string path_;
};

// A private folder (mode 0700) made from a mkdtemp pattern ("/tmp/name.XXXXXX"), removed
// with everything in it when it goes away.
class ScopedTempDir {
  public:
    explicit ScopedTempDir(std::string pattern) {
        if (::mkdtemp(&pattern[0]) != nullptr)
            path_ = std::move(pattern);
    }
    ~ScopedTempDir() {
        std::error_code ignored;
        if (!path_.empty())
            std::filesystem::remove_all(path_, ignored);
    }
    ScopedTempDir(const ScopedTempDir&) = delete;
    ScopedTempDir& operator=(const ScopedTempDir&) = delete;
    bool Made() const { return !path_.empty(); }
    const std::string& Path() const { return path_; }

  private:
    std::string path_;
};

// Waits for one child, retrying when a signal interrupts the wait.  Returns waitpid's
// result (the pid, or -1 with errno set).
inline pid_t WaitForChild(pid_t pid, int* status) {
    pid_t r;
    do {
        r = ::waitpid(pid, status, 0);
    } while (r < 0 && errno == EINTR);
    return r;
}

// read(2) that retries when a signal interrupts it.
inline ssize_t ReadRetry(int fd, void* buf, size_t size) {
    ssize_t n;
    do {
        n = ::read(fd, buf, size);
    } while (n < 0 && errno == EINTR);
    return n;
}

struct SzListFree {
    void operator()(PKLIBC_SZLIST list) const { KLIBCSzListFree(list); }
};
// Owns a platform string list.
using UniqueSzList = std::unique_ptr<KLIBC_SZLIST, SzListFree>;

struct MountVolListFree {
    void operator()(PKYTO_MOUNT_VOL_INFO list) const { KYTOMountVolInfoFree(list); }
};
// Owns the platform's list of mounted volumes.
using UniqueMountVolList = std::unique_ptr<KYTO_MOUNT_VOL_INFO, MountVolListFree>;

// A getline buffer that is freed on every way out.
struct LineBuffer {
    char* data = nullptr;
    size_t size = 0;
    LineBuffer() = default;
    LineBuffer(const LineBuffer&) = delete;
    LineBuffer& operator=(const LineBuffer&) = delete;
    ~LineBuffer() { free(data); }
    ssize_t Read(FILE* f) { return getline(&data, &size, f); }
};

// Writes all of data, retrying short writes and interruptions.  False at the first error
// (errno set) or a write that writes nothing.
inline bool WriteAll(int fd, const void* data, size_t size) {
    const char* p = static_cast<const char*>(data);
    while (size > 0) {
        const ssize_t n = ::write(fd, p, size);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0)
            return false;
        p += n;
        size -= static_cast<size_t>(n);
    }
    return true;
}

inline bool WriteAll(int fd, const std::string& data) {
    return WriteAll(fd, data.data(), data.size());
}

}  // namespace kyto
#pragma GCC visibility pop

#endif
