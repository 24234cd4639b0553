// Data volumes from the mount table, free space to the byte, and folder creation.
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <kytoplatform/kytoplatform.h>

#include "sandbox.h"

namespace {

constexpr unsigned long long kMiB = 1024ULL * 1024ULL;

class VolumesTest : public kytotest::SandboxTest {};

struct Vol {
    std::string path;
    int writable;
    unsigned long long free;
    bool operator==(const Vol& o) const {
        return path == o.path && writable == o.writable && free == o.free;
    }
};

std::ostream& operator<<(std::ostream& os, const Vol& v) {
    return os << v.path << " w=" << v.writable << " free=" << v.free;
}

std::vector<Vol> Enumerate() {
    std::vector<Vol> out;
    PKYTO_MOUNT_VOL_INFO list = KYTOMountVolInfoEnum(0);
    for (PKYTO_MOUNT_VOL_INFO v = list; v; v = v->pNext) {
        out.push_back(Vol{v->szMountPath, v->blWritable, v->ullFreeBytes});
    }
    KYTOMountVolInfoFree(list);
    return out;
}

TEST_F(VolumesTest, NoDataVolume) {
    kytotest::MountVolume("/volumeUSB1", 10 * kMiB);
    kytotest::MountVolume("/volume", 10 * kMiB);
    kytotest::MountVolume("/mnt/volume1", 10 * kMiB);
    KLIBCErrSetEx(0, "", 0);
    EXPECT_EQ(KYTOMountVolInfoEnum(0), nullptr);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_NOT_FOUND);

    // "None" is an answer, not a failure: the caller's error stays as it was.
    KLIBCErrSetEx(0, "", 0);
    KYTO_VOLUME_INFO out;
    EXPECT_EQ(VolumeAvailGet(0, 0, &out, 1), 0);
    EXPECT_EQ(KLIBCErrGet(), 0);
}

TEST_F(VolumesTest, ListsDataVolumesInMountOrderWithExactFreeBytes) {
    kytotest::MountVolume("/volume2", 100 * kMiB);
    kytotest::MountVolume("/volumeUSB1", 500 * kMiB);
    kytotest::MountVolume("/volume1", 400 * kMiB, true);
    kytotest::MountVolume("/volume10", 200 * kMiB);
    kytotest::MountVolume("/volume1x", 300 * kMiB);
    EXPECT_EQ(Enumerate(), (std::vector<Vol>{{"/volume2", 1, 100 * kMiB},
                                             {"/volume1", 0, 400 * kMiB},
                                             {"/volume10", 1, 200 * kMiB}}));

    // Free space is measured at the time of the call.
    kytotest::WriteFile("/volume2/data", std::string(3 * kMiB, 'x'));
    EXPECT_EQ(Enumerate()[0], (Vol{"/volume2", 1, 97 * kMiB}));

    KLIBCErrSetEx(0, "", 0);
    EXPECT_EQ(KYTOMountVolInfoEnum(1), nullptr);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    KYTOMountVolInfoFree(nullptr);
}

TEST_F(VolumesTest, AvailGetPicksFirstWritableVolumeWithMoreThanMinFree) {
    kytotest::MountVolume("/volume1", 100 * kMiB);
    kytotest::MountVolume("/volume2", 400 * kMiB, true);
    kytotest::MountVolume("/volumeUSB1", 500 * kMiB);
    kytotest::MountVolume("/volume3", 200 * kMiB);
    struct Case {
        unsigned long long minFree;
        int rc;
        const char* path;
    } cases[] = {
        {0, 1, "/volume1"},
        {100 * kMiB - 1, 1, "/volume1"},
        {100 * kMiB, 1, "/volume3"},  // equal is not enough
        {200 * kMiB - 1, 1, "/volume3"},
        {200 * kMiB, 0, ""},  // the read-only and the USB volume never count
    };
    for (const Case& c : cases) {
        KYTO_VOLUME_INFO out[2];
        memset(out, 0, sizeof out);
        EXPECT_EQ(VolumeAvailGet(0, c.minFree, out, 2), c.rc) << c.minFree;
        EXPECT_STREQ(out[0].szMountPath, c.path) << c.minFree;
        if (c.rc == 1) {
            EXPECT_EQ(out[0].blWritable, 1);
            EXPECT_EQ(out[0].ullFreeBytes,
                      std::string(c.path) == "/volume1" ? 100 * kMiB : 200 * kMiB);
        }
    }
}

TEST_F(VolumesTest, AvailGetRejectsBadArguments) {
    kytotest::MountVolume("/volume1", 10 * kMiB);
    KYTO_VOLUME_INFO out;
    struct Case {
        int flags;
        PKYTO_VOLUME_INFO out;
        int count;
    } cases[] = {{1, &out, 1}, {0, nullptr, 1}, {0, &out, 0}, {0, &out, -1}};
    for (const Case& c : cases) {
        KLIBCErrSetEx(0, "", 0);
        EXPECT_EQ(VolumeAvailGet(c.flags, 0, c.out, c.count), -1);
        EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    }
}

TEST_F(VolumesTest, MkdirPCreatesMissingParents) {
    mode_t old = umask(0);
    EXPECT_EQ(KYTOFSMkdirP("/tmp/a/b//c/", 0750), 0);
    EXPECT_TRUE(kytotest::IsDirectory("/tmp/a/b/c"));
    struct stat st;
    ASSERT_EQ(stat("/tmp/a/b/c", &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0750u);
    umask(old);
    EXPECT_EQ(KYTOFSMkdirP("/tmp/a/b/c", 0755), 0);  // already there
    EXPECT_EQ(KYTOFSMkdirP("/", 0755), 0);

    kytotest::WriteFile("/tmp/a/file", "x");
    for (const char* bad : {"/tmp/a/file", "/tmp/a/file/sub"}) {
        KLIBCErrSetEx(0, "", 0);
        EXPECT_EQ(KYTOFSMkdirP(bad, 0755), -1) << bad;
        EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_SYSTEM) << bad;
    }
    EXPECT_EQ(KYTOFSMkdirP(nullptr, 0755), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    EXPECT_EQ(KYTOFSMkdirP("", 0755), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
}

}  // namespace
