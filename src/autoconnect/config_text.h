#ifndef BTBUS_SRC_AUTOCONNECT_CONFIG_TEXT_H
#define BTBUS_SRC_AUTOCONNECT_CONFIG_TEXT_H

#include <string>
#include <vector>

namespace Bluetooth {
namespace internal {

// How the auto-connect operations read an adapter's file: "1,AA:..,BB:..".

// A leading decimal integer (white space before it skipped); false when the
// content does not begin with one.
bool leadingNumber(const std::string& content, long& value);
// The flag read as a boolean, as a stream reads one: 1 is true; 0, any other
// number and no number are false.
bool enabledFlag(const std::string& content);
// The list's pieces: from the third character (past the flag and its comma),
// each up to the next "," or the end.
std::vector<std::string> storedAddresses(const std::string& content);

}  // namespace internal
}  // namespace Bluetooth

#endif
