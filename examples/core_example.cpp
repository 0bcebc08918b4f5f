// Asks the bus daemon for the names on the session bus and prints them, then
// reads one property dictionary back from its text form.
#include <iostream>

#include <bluetooth/btbus.h>

int main() {
    Bluetooth::RemoteObject bus("org.freedesktop.DBus", "/org/freedesktop/DBus",
                                "org.freedesktop.DBus", DBUS_BUS_SESSION);
    std::vector<std::string> names;
    if (bus.newMessage("ListNames") != 0 || bus.sendMessage(true, -1) != 0 ||
        bus.getReplyValue(names) != 0) {
        std::cerr << "ListNames failed: " << bus.getErrorMessage() << std::endl;
        return 1;
    }
    std::cout << names.size() << " names on the session bus:" << std::endl;
    for (size_t i = 0; i < names.size(); ++i) std::cout << "  " << names[i] << std::endl;

    Bluetooth::Dict* dict = Bluetooth::stringDivideToDict("Address: 00:11:22:33:44:55;Class: 7936;", ";");
    if (dict != 0) std::cout << Bluetooth::dictToString(*dict);
    delete dict;
    return 0;
}
