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
    if (isspace(static_cast<unsigned char>(text.front())) || isspace(static_cast<unsigned char>(text.back()))) return false;
    return text.find(';') == std::string::npos && (!isName || text.find(':') == std::string::npos);
}

void onFound(RemoteObject*, const char* address, const Dict* properties) {
    std::string separator = ";";
    std::string info = dictConquerToString(*properties, separator);
    std::unique_ptr<Dict> read(stringDivideToDict(info, separator));
    bool intact = !properties->empty();
    for (const Entry& entry : *properties)
        intact = intact && carried(entry.first, true) && carried(variantToString(entry.second), false);
    if (!intact) return;  // the form has no escaping: such text is cut, by design
    fuzz::require(read != 0 && read->size() == properties->size(), "every property read back");
    for (size_t i = 0; i < read->size(); ++i)
        fuzz::require((*read)[i].first == (*properties)[i].first &&
                          variantToString((*read)[i].second) == variantToString((*properties)[i].second),
                      "each property's name and text");
    (void)address;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static bool ready = fuzz::offline();
    static RemoteObject adapter("org.bluez", "/org/bluez/1/hci0", "org.bluez.Adapter", DBUS_BUS_SYSTEM);
    static bool listening = [] {
        RemoteObject::signalHandlerVectorStringDict.push_back(
            SignalHandler<SignalFunctionStringDict>(&adapter, "DeviceFound", &onFound));
        return true;
    }();
    (void)ready;
    (void)listening;
    DBusMessage* message = fuzz::demarshal(data, size);
    if (message == 0) return 0;
    RemoteObject::signalHandlerDispatcherStringDict(&adapter, message);
    dbus_message_unref(message);
    return 0;
}
