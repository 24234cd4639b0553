// The one writer of the shared download status file "/var/run/downloadVYX.status", used by
// both engines: the interface's poller and the facade read it to tell which download runs,
// how far it got and how it ended.  Also the conversion of a computed percentage, so that
// a bogus total or image count in the files cannot make it undefined.  Internal header:
// not installed.
#ifndef KYTOINSTALLCPP_DOWNLOAD_STATUS_H
#define KYTOINSTALLCPP_DOWNLOAD_STATUS_H

namespace kyto {

// Sets key = value in the status file.  lineFormat: nullptr for the platform's default
// line form, or kQuotedLineFormat.  Returns KLIBCFileSetKeyValue's result (< 0 error,
// the platform's last error set).
int SetDownloadStatusKey(const char* key, const char* value, const char* lineFormat);
// The same with a number, written with "%d".
int SetDownloadStatusNumber(const char* key, int value, const char* lineFormat);

// floor(value) as an int; finite values beyond int's range are held at its limits and
// infinity or NaN give 0, where a plain conversion would be undefined.  Values
// inside the range, those above 100 included, are converted unchanged.
int PercentageToInt(double value);

}  // namespace kyto

#endif
