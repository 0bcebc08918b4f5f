#ifndef BTBUS_SRC_SCANNER_GUARDED_H
#define BTBUS_SRC_SCANNER_GUARDED_H

#include <exception>

#include "core/log.h"

namespace Bluetooth {
namespace internal {

// Runs work where GLib or the receiving thread called in: nothing may escape
// to C code. An exception is logged as "<what> failed (<why>)" and gives false.
template <typename Work>
bool guarded(const char* file, int line, const char* what, Work work) {
    try {
        work();
        return true;
    } catch (const std::exception& e) {
        logError(file, line, "%s failed (%s)", what, e.what());
    } catch (...) {
        logError(file, line, "%s failed", what);
    }
    return false;
}

}  // namespace internal
}  // namespace Bluetooth

#endif
