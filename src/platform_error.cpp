#include "platform_error.h"

#include <stdio.h>

#include <kytoplatform/klibc.h>

namespace kyto {

std::string LastErrorText() {
    const int code = KLIBCErrGet();
    const char* file = KLIBCErrorGetFile();
    const int line = KLIBCErrorGetLine();
    char text[320];
    snprintf(text, sizeof(text), "[0x%04X %s:%d]", code, file ? file : "", line);
    return text;
}

}  // namespace kyto
