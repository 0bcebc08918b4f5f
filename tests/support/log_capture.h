#ifndef BTBUS_TESTS_SUPPORT_LOG_CAPTURE_H
#define BTBUS_TESTS_SUPPORT_LOG_CAPTURE_H

#include <string>
#include <vector>

namespace btbus_test {

// While alive, the library's error log lines ("file:line message") are kept
// here instead of going to syslog. Lines from any thread are captured.
class LogCapture {
public:
    LogCapture();
    ~LogCapture();
    std::vector<std::string> lines() const;
    size_t count(const std::string& line) const;
    // Lines that end with text (the "file:line " prefix aside).
    size_t countEndingWith(const std::string& text) const;
    // The messages of the lines "file:<line> message" from file, in order.
    std::vector<std::string> from(const std::string& file) const;
    void clear();

    LogCapture(const LogCapture&) = delete;
    LogCapture& operator=(const LogCapture&) = delete;
};

}  // namespace btbus_test

#endif
