#include "core/log.h"

#include <cstdarg>
#include <cstdio>
#include <string>

#include <syslog.h>

namespace Bluetooth {
namespace internal {

namespace {

void syslogSink(const char* line) { syslog(LOG_ERR, "%s", line); }

LogSink gSink = &syslogSink;

}  // namespace

void logError(const char* file, int line, const char* format, ...) {
    char text[1024];
    va_list args;
    va_start(args, format);
    vsnprintf(text, sizeof text, format, args);
    va_end(args);
    char full[1200];
    snprintf(full, sizeof full, "%s:%d %s", file, line, text);
    gSink(full);
}

LogSink setLogSink(LogSink sink) {
    LogSink previous = gSink;
    gSink = sink ? sink : &syslogSink;
    return previous;
}

}  // namespace internal
}  // namespace Bluetooth
