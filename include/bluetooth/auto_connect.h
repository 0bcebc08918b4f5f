#ifndef BTBUS_BLUETOOTH_AUTO_CONNECT_H
#define BTBUS_BLUETOOTH_AUTO_CONNECT_H

#include <bluetooth/adapter.h>

namespace Bluetooth {

/// The auto-connect configuration of each local adapter, and the control of the
/// auto-connect daemon that acts on it.
///
/// One file per adapter, "/etc/bluetooth/autoconnect/<adapter address>", holds
/// one line without a line feed: the enable flag ("1" or "0"), then ","
/// and a device address per device ("1,AA:BB:CC:DD:EE:01,AA:BB:CC:DD:EE:02").
/// A new file holds "0". Files are replaced whole (a new file written beside,
/// flushed and renamed over), so a crash or a full disk never leaves half a
/// list; nothing is locked, and of two concurrent writers the last one wins.
///
/// Commands reach the daemon through the named pipe
/// "/tmp/quill_bluetooth_autoconnect" as their bare bytes; with no daemon
/// reading it a command fails at once and is lost.
///
/// There is no state: any instance serves. Failures are logged; adapter and
/// device addresses are texts as the caller gives them.
class AutoConnect {
public:
    /// Whether the file at path exists as a regular file (a link to one counts)
    /// that this process may read and write. A missing file is created holding
    /// "0", with its directory "/etc/bluetooth/autoconnect/" (mode 0755; only
    /// that last level) when needed.
    bool checkConfigFile(const char* path) const;
    /// The adapter's enable flag: true when the file begins with a number other
    /// than 0. A missing file is created disabled.
    bool getEnable(const char* adapter) const;
    /// Replaces the adapter's file with the flag followed by deviceList, which
    /// is in the file's form (each address preceded by ",", "" for none) and is
    /// written unchecked, then tells the daemon to reload (whether or not that
    /// reaches it). False, with the file as it was, on failure.
    bool set(const char* adapter, bool enable, const char* deviceList);
    /// Drops every occurrence of device from the adapter's list and reloads.
    /// A disabled file is left alone, on purpose (true all the same). True once
    /// the file was read, even if rewriting it failed (logged).
    bool removeDevice(const char* adapter, const char* device);
    /// The adapter's stored devices that bluetoothd knows, as a new list owned
    /// by the caller; addresses it does not know are removed from an enabled
    /// file. The flag is not consulted. Null on failure.
    DeviceList* getDeviceList(const char* adapter);
    /// The stored devices of every powered adapter whose auto-connect is
    /// enabled, pruned as getDeviceList does, as one new list owned by the
    /// caller (empty when nothing qualifies). Null when the adapters cannot be
    /// listed.
    DeviceList* getAutoConnectDeviceList();
    /// Writes command's bytes (no terminator) to the daemon's pipe: true when
    /// all of them were written.
    bool sendCommand(const char* command) const;
    /// sendCommand of "1", "pause" and "resume".
    ///@{
    bool reload() const;
    bool pause() const;
    bool resume() const;
    ///@}
};

}  // namespace Bluetooth

#endif
