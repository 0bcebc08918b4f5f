#ifndef BTBUS_BLUETOOTH_CONNECTION_H
#define BTBUS_BLUETOOTH_CONNECTION_H

#include <dbus/dbus.h>

namespace Bluetooth {

/// Access to libdbus's shared bus connections: one per bus and process.
class Connection {
public:
    /// Takes one more reference on the shared connection for the bus type.
    /// Logs "Failed to get bus connection" and returns null when the bus cannot
    /// be reached. Nothing is cached here: every call asks libdbus again.
    static DBusConnection* get(DBusBusType type);

    /// Drops one reference taken by get(); null is ignored.
    static void unref(DBusConnection* connection);
};

}  // namespace Bluetooth

#endif
