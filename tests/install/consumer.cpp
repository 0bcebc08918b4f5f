// A user's program, built as C++11 against the installed headers: btbus.h includes them all.
#include <cstdlib>
#include <iostream>
#include <string>

#include <bluetooth/btbus.h>

int main() {
    std::string separator = ";";
    Bluetooth::Dict dict;
    dict.push_back(Bluetooth::Entry("Class", Bluetooth::Variant(7936u)));
    Bluetooth::Dict* back = Bluetooth::stringDivideToDict(Bluetooth::dictConquerToString(dict, separator), separator);
    bool ok = back != 0 && back->size() == 1 && Bluetooth::find(back, "Class") == "7936";
    delete back;
    char* address = Bluetooth::getAddressFromPath("/org/bluez/1/hci0/dev_00_11_22_33_44_55");
    ok = ok && address != 0 && std::string(address) == "00:11:22:33:44:55";
    free(address);

    // No bus is reachable here: the object reports that through its error state.
    Bluetooth::RemoteObject manager("org.bluez", "/", "org.bluez.Manager", DBUS_BUS_SYSTEM);
    ok = ok && manager.newMessage("DefaultAdapter") == 0 && manager.sendMessage(true, -1) == -1 &&
         manager.getErrorNumber() == 11;
    // The scanner's client asks BlueZ first, which is not there either.
    Bluetooth::Scanner scanner;
    ok = ok && scanner.listDevices("hci0", false) == 0 && !scanner.removeFinder("hci0");
    // Built against the headers of the release it runs with.
#if !BTBUS_VERSION_AT_LEAST(0, 2, 0)
#error "btbus.h gives no version"
#endif
    ok = ok && std::string(Bluetooth::version()) == BTBUS_VERSION;
    std::cout << (ok ? "consumer ok" : "consumer FAILED") << std::endl;
    return ok ? 0 : 1;
}
