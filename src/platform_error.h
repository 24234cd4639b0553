// The ending of every log line about a failed platform call: "[0x%04X %s:%d]" filled with
// the platform's last error code, file and line, so that log readers can find where the
// platform gave up.  Internal header: not installed.
#ifndef KYTOINSTALLCPP_PLATFORM_ERROR_H
#define KYTOINSTALLCPP_PLATFORM_ERROR_H

#include <string>

namespace kyto {

// "[0x0D02 keyvalue.cpp:88]": the platform's last error, read now.
std::string LastErrorText();

}  // namespace kyto

#endif
