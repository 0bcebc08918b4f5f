#include "support/log_capture.h"

#include <algorithm>
#include <mutex>

#include "core/log.h"

namespace btbus_test {

namespace {

std::mutex gLock;
std::vector<std::string> gLines;

void keep(const char* line) {
    std::lock_guard<std::mutex> lock(gLock);
    gLines.push_back(line);
}

}  // namespace

LogCapture::LogCapture() {
    clear();
    Bluetooth::internal::setLogSink(&keep);
}

LogCapture::~LogCapture() { Bluetooth::internal::setLogSink(nullptr); }

std::vector<std::string> LogCapture::lines() const {
    std::lock_guard<std::mutex> lock(gLock);
    return gLines;
}

size_t LogCapture::count(const std::string& line) const {
    std::lock_guard<std::mutex> lock(gLock);
    return std::count(gLines.begin(), gLines.end(), line);
}

size_t LogCapture::countEndingWith(const std::string& text) const {
    std::lock_guard<std::mutex> lock(gLock);
    return std::count_if(gLines.begin(), gLines.end(), [&](const std::string& line) {
        return line.size() >= text.size() && line.compare(line.size() - text.size(), text.size(), text) == 0;
    });
}

std::vector<std::string> LogCapture::from(const std::string& file) const {
    std::lock_guard<std::mutex> lock(gLock);
    std::vector<std::string> messages;
    for (const std::string& line : gLines) {
        std::string::size_type digits = file.size() + 1, blank = line.find(' ');
        if (line.compare(0, digits, file + ":") == 0 && blank != std::string::npos && blank > digits &&
            line.find_first_not_of("0123456789", digits) == blank)
            messages.push_back(line.substr(blank + 1));
    }
    return messages;
}

void LogCapture::clear() {
    std::lock_guard<std::mutex> lock(gLock);
    gLines.clear();
}

}  // namespace btbus_test
