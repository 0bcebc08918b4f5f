// Asks the BlueZ daemon (or bluez4-sim) for its default adapter and prints the
// adapter's properties, using the client core alone.
#include <iostream>

#include <bluetooth/btbus.h>

int main() {
    Bluetooth::RemoteObject manager("org.bluez", "/", "org.bluez.Manager", DBUS_BUS_SYSTEM);
    Bluetooth::ObjectPath adapterPath;
    if (manager.newMessage("DefaultAdapter") != 0 || manager.sendMessage(true, -1) != 0 ||
        manager.getReplyValue(adapterPath) != 0) {
        std::cerr << "no default adapter: " << manager.getErrorMessage() << std::endl;
        return 1;
    }
    std::cout << "Default adapter: " << adapterPath.c_str() << std::endl;

    Bluetooth::RemoteObject adapter("org.bluez", adapterPath, "org.bluez.Adapter", DBUS_BUS_SYSTEM);
    Bluetooth::Dict properties;
    if (adapter.newMessage("GetProperties") != 0 || adapter.sendMessage(true, -1) != 0 ||
        adapter.getReplyValue(properties) != 0) {
        std::cerr << "GetProperties failed: " << adapter.getErrorMessage() << std::endl;
        return 1;
    }
    std::cout << Bluetooth::dictToString(properties);
    return 0;
}
