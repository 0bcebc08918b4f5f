#include <bluetooth/dbus_object.h>

#include "core/call.h"

BT_LOG_FILE("dbus_object.cpp");

namespace Bluetooth {

namespace {
const internal::Op kListNames = { "ListNames", internal::kWaitReply, 42 };
}

DBusObject::DBusObject()
    : RemoteObject("org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
                   DBUS_BUS_SYSTEM) {}

// Before this class's part is gone: a handler may look at the whole object.
DBusObject::~DBusObject() { releaseHandlers(); }

std::vector<std::string>* DBusObject::listNames() {
    std::vector<std::string>* names = new std::vector<std::string>;
    internal::call(*this, kLogFile, kListNames, names);
    return names;
}

}  // namespace Bluetooth
