// The scanner's DeviceFound path: the signal decoded as the receiving thread
// decodes it, the device's properties kept as text as the service keeps them,
// and read back into a dictionary as the Scanner client reads each answer.
#include <memory>

#include <bluetooth/btbus.h>

#include "fuzz.h"

using namespace Bluetooth;

namespace {

// Whether text can cross the scanner's form unchanged.
bool carried(const std::string& text, bool isName) {
    if (text.empty()) return !isName;
    unsigned char first = text.front(), last = text.back();
    if (isspace(first) || isspace(last)) return false;
    return text.find(';') == std::string::npos && (!isName || text.find(':') == std::string::npos);
}

void onFound(RemoteObject*, const char*, const Dict* properties) {
    std::string separator = ";", info = dictConquerToString(*properties, separator);
    std::unique_ptr<Dict> read(stringDivideToDict(info, separator));
    bool intact = !properties->empty();
    for (const Entry& entry : *properties)
        intact = intact && carried(entry.first, true) && carried(variantToString(entry.second), false);
    // The form has no escaping: other text is cut, by design. Names and texts
    // that it carries are read back as they were, so they write the same text.
    fuzz::require(!intact || (read != 0 && dictConquerToString(*read, separator) == info), "each property read back");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static RemoteObject adapter("org.bluez", "/org/bluez/1/hci0", "org.bluez.Adapter", DBUS_BUS_SYSTEM);
    [[maybe_unused]] static bool listening = [] {  // no bus to ask for a match rule: straight into the list
        RemoteObject::signalHandlerVectorStringDict.push_back({ &adapter, "DeviceFound", &onFound });
        return true;
    }();
    return fuzz::withMessage(data, size, [](DBusMessage* message) {
        RemoteObject::signalHandlerDispatcherStringDict(&adapter, message);
    });
}
