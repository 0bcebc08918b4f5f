#ifndef BTBUS_BLUETOOTH_UTIL_H
#define BTBUS_BLUETOOTH_UTIL_H

#include <string>
#include <vector>

#include <bluetooth/variant.h>

namespace Bluetooth {

// The text form of values and property dictionaries. Writing is lossy: values
// are written bare, and reading gives every value back as a string.

/// "[a, b]"; "[]" for an empty list. Elements are not escaped.
std::string stringArrayToString(const std::vector<std::string>& values);
/// The held boolean; false for every other alternative.
bool variantToBool(const Variant& value);
/// Decimal numbers, "1"/"0" for booleans, strings as they are, lists as above.
std::string variantToString(const Variant& value);
/// "name: value\n" per entry, in order; "" for an empty dictionary.
std::string dictToString(const Dict& dict);
/// Like dictToString, with separator written after every entry instead of "\n".
/// The separator is only read.
std::string dictConquerToString(const Dict& dict, std::string& separator);
/// Text form of the first entry named exactly name; "" when there is none or
/// when dict or name is null.
std::string find(const Dict* dict, const char* name);
/// Parses "name: value" (split at the first colon, both sides trimmed) into a
/// new Entry holding the value as a string; null when text holds no colon.
Entry* stringToEntry(const std::string& text);
/// Parses entries each closed by one of the characters in separators; text after
/// the last separator is ignored and pieces without a colon are skipped. A new
/// Dict, or null when text holds no separator or no piece made an entry.
Dict* stringDivideToDict(const std::string& text, const std::string& separators);

// Daemon, radio and PID-file helpers. Failures of restartBluetoothd and
// createPidFile are logged; the others report by their result only.

/// How long getNameFromAddr waits for the remote device's answer, in
/// milliseconds.
enum GetNameTimeout {
    GET_NAME_TIMEOUT_SHORT = 5000,     ///< a device known to be near and awake
    GET_NAME_TIMEOUT_DEFAULT = 10000,
    GET_NAME_TIMEOUT_LONG = 25000      // a device that may be slow to answer a page
};

/// Kills a running bluetoothd (SIGKILL) and starts "/usr/sbin/bluetoothd"
/// again, but only when a file "/tmp/bluetooth.info_*" tells that an adapter is
/// attached; otherwise a running daemon is left alone. 0 when bluetoothd runs
/// afterwards, -1 otherwise.
int restartBluetoothd();
/// The address in a BlueZ device path: everything after the first "dev_", with
/// every "_" turned into ":" (".../hci0/dev_00_11_22_33_44_55" gives
/// "00:11:22:33:44:55"). A new string to free() with free, or null when path is
/// null or holds no "dev_".
char* getAddressFromPath(const char* path);
/// Reads the name of the remote device at address over HCI, through the local
/// adapter that reaches it, waiting at most timeout. 0 with the name in name
/// (cut to length - 1 characters, always terminated); -1 on failure, name then
/// untouched.
int getNameFromAddr(const char* address, char* name, int length, GetNameTimeout timeout);

/// Claims path as the PID file of a single-instance daemon: opens (creating it
/// with mode 0600) and write-locks it without waiting, then writes this
/// process's id and a line feed. With bit 0 of flags set the descriptor is
/// closed on exec. Returns the descriptor, which holds the lock until it is
/// closed or the process ends; -1 on failure (another process holding the lock
/// is logged as "already running" only when reportRunning is true).
int createPidFile(const char* path, int flags, bool reportRunning);

}  // namespace Bluetooth

#endif
