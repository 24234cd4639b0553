/*
 * Appliance system services: the system event log, data volumes and folders, the
 * high-availability state and the start-up scripts.  Every call has C linkage and sets
 * the thread's last error (klibc.h) when it fails.
 */
#ifndef KYTOPLATFORM_KYTO_SYSTEM_H
#define KYTOPLATFORM_KYTO_SYSTEM_H

#include <sys/types.h>

#include "kyto_errors.h"

/* Built with hidden symbols by default: every call declared here is exported. */
#pragma GCC visibility push(default)

#ifdef __cplusplus
extern "C" {
#endif

/* ---- System event log --------------------------------------------------------------- */

#define KYTO_EVENT_LOG_PATH "/var/log/kytoevent.log"

/* Appends one line "category level 0xCODE s1 s2 s3 s4" (NULL strings as "") to
 * /var/log/kytoevent.log and sends the same text to syslog (LOG_NOTICE).  0 ok, -1 error. */
int KYTOLogSet1(int category, int level, unsigned int eventCode, const char* s1, const char* s2,
                const char* s3, const char* s4) KYTO_NOEXCEPT;

/* ---- Volumes and folders ------------------------------------------------------------ */

#define KYTO_VOL_PATH_MAX 4096

/* One mounted data volume: a file system mounted at "/volume" followed by digits only. */
typedef struct _tag_KYTO_MOUNT_VOL_INFO {
    char szMountPath[KYTO_VOL_PATH_MAX];
    int blWritable;                  /* mounted read-write and not ST_RDONLY */
    unsigned long long ullFreeBytes; /* f_bavail * f_frsize */
    struct _tag_KYTO_MOUNT_VOL_INFO* pNext;
} KYTO_MOUNT_VOL_INFO, *PKYTO_MOUNT_VOL_INFO;

typedef struct _tag_KYTO_VOLUME_INFO {
    char szMountPath[KYTO_VOL_PATH_MAX];
    int blWritable;
    unsigned long long ullFreeBytes;
} KYTO_VOLUME_INFO, *PKYTO_VOLUME_INFO;

/* Linked list of the data volumes in /proc/mounts order.  NULL when there are none (last
 * error KYTO_ERR_NOT_FOUND) or on error (another code; a volume that cannot be queried
 * with statvfs gives KYTO_ERR_SYSTEM).  flags must be 0.  A mount point mounted over more
 * than once is listed once, at its first position, as the last (visible) mount.  Escaped
 * characters in /proc/mounts (\040 ...) are decoded. */
PKYTO_MOUNT_VOL_INFO KYTOMountVolInfoEnum(int flags) KYTO_NOEXCEPT;
/* Frees the list from node on; NULL is fine. */
void KYTOMountVolInfoFree(PKYTO_MOUNT_VOL_INFO node) KYTO_NOEXCEPT;
/* Fills out[0] with the first writable data volume whose free bytes are greater than
 * minFree.  count is the number of entries out can hold (at least 1).  1 found, 0 none
 * (no data volume at all is "none", not an error), -1 error. */
int VolumeAvailGet(int flags, unsigned long long minFree, PKYTO_VOLUME_INFO out,
                   int count) KYTO_NOEXCEPT;
/* Creates the folder and its missing parents with mode; 0 ok (also when it already exists
 * as a folder), -1 error. */
int KYTOFSMkdirP(const char* path, mode_t mode) KYTO_NOEXCEPT;

/* ---- High availability -------------------------------------------------------------- */

#define KYTO_HA_STATUS_PATH "/var/run/kytoha.status"

/* 1 when /var/run/kytoha.status says running="yes", else 0 (a status file that exists
 * but cannot be read also gives 0, with the last error set). */
int KYTOHAIsRunning(void) KYTO_NOEXCEPT;
/* 1 when the file says hybrid_dl="yes", with partner_unique copied into the buffer (cut to
 * size - 1); 0 when not hybrid (or no file); -1 when the file exists but cannot be read,
 * the partner identity is missing, or an argument is bad. */
int KYTOHAIsHybridDL(char* partnerUnique, int size) KYTO_NOEXCEPT;

/* ---- Services ----------------------------------------------------------------------- */

#define KYTO_SERVICE_STOP_ALL 1
#define KYTO_SERVICE_START_ALL 2

/* 1: runs every /usr/kyto/etc/rc.d/S*.sh with "stop", highest name first; 2: every one
 * with "start", in name order.  Blocks until done; 0 ok, -1 bad action or no script
 * folder.  Names are ordered bytewise (not by locale); only regular files are run, each
 * directly with execv.  As in an init system, a script that fails or cannot be executed
 * does not stop the others and does not change the result. */
int KYTOServiceOnOffALL(int action) KYTO_NOEXCEPT;
/* Runs /usr/kyto/bin/kytopkg with "startall" (blStart != 0) or "stopall"; returns its
 * exit status, -1 when it cannot run. */
int KYTOServiceThirdPartyAll(int blStart) KYTO_NOEXCEPT;

#ifdef __cplusplus
}
#endif

#pragma GCC visibility pop

#endif
