// What every command of kytoupdate shares: the exit codes (kytoupdate_exit.h), the notes and
// errors on standard error, the stop signals, and the words the commands print for the
// library's numbers.  Each command is declared here and defined in the file of its concern:
// kytoupdate_download.cpp, kytoupdate_apply.cpp, kytoupdate_plan.cpp, kytoupdate_auto.cpp
// and kytoupdate_status.cpp.
#ifndef KYTOUPDATE_COMMON_H
#define KYTOUPDATE_COMMON_H

#include <signal.h>

#include <functional>
#include <string>

#include "kytoupdate_exit.h"
#include "scoped.h"
#include "smallupdate.h"
#include "systemupdate.h"

namespace kytoupdate {

// What SmallUpdate::GetServiceRestartType answers; the library names none of its numbers.
constexpr int kRestartNone = 0;
constexpr int kRestartPartial = 1;  // the listed start-up scripts and add-on packages
constexpr int kRestartAll = 2;      // every start-up script but the invalid-restart ones
constexpr int kRestartReboot = 3;   // every service through the platform, then a reboot

// Set by SIGINT or SIGTERM once CatchStopSignals ran.
extern volatile sig_atomic_t g_interrupted;
void CatchStopSignals();
void SleepMs(long ms);

// "kytoupdate: <text>" on standard error; Fail returns code for the caller to exit with.
void Note(const std::string& text);
int Fail(const std::string& text, int code = kExitFailed);
// Takes the lock file at path without waiting into lock; -1 when taken, else the exit code,
// with busyText (another process holds it) or the open failure noted.  The lock lasts as
// long as the descriptor and the children forked while it is open.
int TryLock(const char* path, const std::string& busyText, kyto::UniqueFd& lock);

// Words printed for the library's numbers.
const char* RestartWord(int restartType);
std::string KindWord(int patchType);  // a SystemUpdate's m_updateType
std::string SmallErrnoText(int errorCode);

// ---- Commands (exit codes) ----
int CmdCheck();
int CmdDownload();
int CmdCancel();
int CmdStatus(bool json, bool watch, double interval);
int CmdApply();
int CmdServices(const std::string& action);
int CmdImport(const std::string& archive);
int CmdPlan(bool json);
int CmdAuto();

// Checks, then downloads the update found, choosing su's kind.  An exit code, or -1 when
// the update was downloaded.
int CheckAndDownload(SystemUpdate& su);
// Stops the services the update touches, applies it with applyFn, then starts them again,
// or, when the update (or a running cluster) needs a reboot, says so and leaves them to it.
int ApplyWithServices(SmallUpdate& u, const std::function<bool()>& applyFn);

}  // namespace kytoupdate

#endif
