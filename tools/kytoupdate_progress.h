// The download display of kytoupdate: on a terminal one progress bar redrawn in place
// (percentage, image or package n of m, rate, time left); otherwise one plain line each
// time what it shows changes, so that a log or a script reading the output gets a short,
// stable record.
#ifndef KYTOUPDATE_PROGRESS_H
#define KYTOUPDATE_PROGRESS_H

#include <stdio.h>

#include <string>

namespace kytoupdate {

struct ProgressSample {
    double seconds = 0;            // since the download started
    int percentage = 0;            // overall, 0..100
    int item = 0;                  // image or package being fetched, from 1 (0: not known)
    int items = 0;                 // how many (0: not known)
    unsigned long long bytes = 0;  // bytes on disk of the current item(s)
};

class ProgressView {
  public:
    // unit: "image" or "package".  terminal: draw a bar; width: the terminal's columns.
    ProgressView(FILE* out, bool terminal, int width, const std::string& unit);
    void Update(const ProgressSample& sample);
    // Ends the bar's line (terminal) so that the next text starts on a fresh line.
    void Finish();

    // Text pieces, public for the tests of the formatting.
    static std::string FormatRate(double bytesPerSecond);
    static std::string FormatDuration(double seconds);

  private:
    std::string Details(const ProgressSample& s) const;

    FILE* out_;
    bool terminal_;
    int width_;
    std::string unit_;
    bool drawn_ = false;
    std::string lastPlain_;
    // Rate: bytes per second, smoothed; rebased when the item changes (a new file).
    double rate_ = -1;
    double lastSeconds_ = 0;
    unsigned long long lastBytes_ = 0;
    int lastItem_ = -1;
};

}  // namespace kytoupdate

#endif
