// File-system helpers shared by both engines: free space of a path, the walk over the
// mounted data volumes that picks a download place, and folder removal.  Internal header:
// not installed.
#ifndef KYTOINSTALLCPP_FILE_SYSTEM_H
#define KYTOINSTALLCPP_FILE_SYSTEM_H

#include <kytoplatform/kyto_system.h>

namespace kyto {

// Available bytes (for unprivileged users) of the file system holding path, in 64 bits.
// 0 on success; -1 with errno set when statfs fails.
int AvailableBytes(const char* path, unsigned long long& available);

// First writable volume of the list (from node on, in the platform's order) with at least
// minFreeBytes free; nullptr when none.  Every volume passed over is logged at LOG_ERR under
// module, read-only ones as "sad.. %s is not a writable volume.", small ones as
// "%llu < %lu, check next volume."; with announceEach, every volume is also announced
// ("Got a volume %s.") and every writable one checked aloud, for the support staff
// reading how an outside image found its place.
PKYTO_MOUNT_VOL_INFO FirstVolumeWithRoom(PKYTO_MOUNT_VOL_INFO node, unsigned long minFreeBytes,
                                         const char* module, bool announceEach);

// Removes a folder and everything in it with rmProgram "-rf" through KLIBCExec (the
// absolute "/bin/rm", or "bin/rm" where the apply relies on the caller's working folder).
// 1 when the tool succeeded, 0 otherwise or for a null path (the platform error is then
// 0x0D00: without an operand "rm -rf" would succeed doing nothing).
int RemoveFolderWith(const char* rmProgram, const char* path);

}  // namespace kyto

#endif
