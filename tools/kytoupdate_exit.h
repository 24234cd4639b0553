// kytoupdate's exit codes (kytoupdate(1)) and the words a person reads for them; shared by
// the program and by the update page's back end, which runs it and reports its end.
#ifndef KYTOUPDATE_EXIT_H
#define KYTOUPDATE_EXIT_H

namespace kytoupdate {

constexpr int kExitOk = 0;           // done; for check: an update is available
constexpr int kExitFailed = 1;       // the operation failed
constexpr int kExitCannotCheck = 2;  // the update server could not be asked
constexpr int kExitUpToDate = 3;     // no update: the system is up to date
constexpr int kExitStopped = 4;      // the download was stopped by a cancel
constexpr int kExitRefused = 5;      // refused: not signed by a trusted key
constexpr int kExitUsage = 64;       // bad command line

// One sentence for an exit code; unknown codes read as a failure.
inline const char* ExitWords(int code) {
    switch (code) {
        case kExitOk:
            return "Done.";
        case kExitCannotCheck:
            return "The update server could not be reached.";
        case kExitUpToDate:
            return "The system is up to date.";
        case kExitStopped:
            return "The download was stopped.";
        case kExitRefused:
            return "Refused: the update is not signed by a trusted key.";
        case kExitUsage:
            return "The request was not understood.";
        default:
            return "The operation failed.";
    }
}

}  // namespace kytoupdate

#endif
