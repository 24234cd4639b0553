#include "download_status.h"

#include <stdio.h>

#include <climits>
#include <cmath>

#include <kytoplatform/klibc.h>

#include "kyto_paths.h"

namespace kyto {

int SetDownloadStatusKey(const char* key, const char* value, const char* lineFormat) {
    return KLIBCFileSetKeyValue(kDownloadStatusFile, key, value, lineFormat);
}

int SetDownloadStatusNumber(const char* key, int value, const char* lineFormat) {
    char text[16] = {0};
    snprintf(text, sizeof(text), "%d", value);
    return SetDownloadStatusKey(key, text, lineFormat);
}

int PercentageToInt(double value) {
    // Infinity (an image count of 0) and NaN read as 0, as pollers have always seen them.
    if (!std::isfinite(value))
        return 0;
    const double whole = std::floor(value);
    if (whole >= static_cast<double>(INT_MAX))
        return INT_MAX;
    if (whole <= static_cast<double>(INT_MIN))
        return INT_MIN;
    return static_cast<int>(whole);
}

}  // namespace kyto
