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

void LogCapture::clear() {
    std::lock_guard<std::mutex> lock(gLock);
    gLines.clear();
}

}  // namespace btbus_test
