#ifndef BTBUS_BLUETOOTH_DBUS_OBJECT_H
#define BTBUS_BLUETOOTH_DBUS_OBJECT_H

#include <string>
#include <vector>

#include <bluetooth/remote_object.h>

namespace Bluetooth {

/// Proxy for the system bus daemon itself ("org.freedesktop.DBus").
class DBusObject : public RemoteObject {
public:
    DBusObject();
    virtual ~DBusObject();

    /// The names currently on the bus, as a new list owned by the caller. Never
    /// null: a failed call (logged once) gives an empty or partly filled list.
    std::vector<std::string>* listNames();
};

}  // namespace Bluetooth

#endif
