#ifndef BTBUS_SRC_UTIL_COMMANDLIB_H
#define BTBUS_SRC_UTIL_COMMANDLIB_H

namespace Bluetooth {
namespace internal {

// The id of the first process, in the text order of "/proc/<id>/exe", whose
// executable's path contains fragment anywhere; -1 when none does (processes
// whose link cannot be read are passed over). Logged when /proc cannot be
// listed.
int findProcessId(const char* fragment);

}  // namespace internal
}  // namespace Bluetooth

#endif
