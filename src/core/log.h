#ifndef BTBUS_SRC_CORE_LOG_H
#define BTBUS_SRC_CORE_LOG_H

namespace Bluetooth {
namespace internal {

// Writes syslog(LOG_ERR) "file:line message". file is the logging source's base
// name; line is pinned by the caller where the log line is part of the contract.
void logError(const char* file, int line, const char* format, ...)
    __attribute__((format(printf, 3, 4)));

// Where formatted lines go; null restores syslog. Returns the previous sink.
// Tests install a sink to read the lines.
typedef void (*LogSink)(const char* line);
LogSink setLogSink(LogSink sink);

}  // namespace internal
}  // namespace Bluetooth

// Once per .cpp file: its base name, since __FILE__ carries the build path.
#define BT_LOG_FILE(name) static const char kLogFile[] = name
#define BT_LOG_ERR(...) ::Bluetooth::internal::logError(kLogFile, __LINE__, __VA_ARGS__)

#endif
