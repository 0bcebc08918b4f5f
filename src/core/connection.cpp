#include <bluetooth/connection.h>

#include "core/log.h"

BT_LOG_FILE("connection.cpp");

namespace Bluetooth {

DBusConnection* Connection::get(DBusBusType type) {
    DBusError error;
    dbus_error_init(&error);
    // Not a private connection: every caller in the process shares libdbus's one.
    DBusConnection* connection = dbus_bus_get(type, &error);
    if (connection == 0) BT_LOG_ERR("Failed to get bus connection");
    dbus_error_free(&error);
    return connection;
}

void Connection::unref(DBusConnection* connection) {
    // libdbus would abort the process on null.
    if (connection != 0) dbus_connection_unref(connection);
}

}  // namespace Bluetooth
