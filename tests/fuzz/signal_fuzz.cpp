// A peer's signal, offered to the five dispatchers with a handler of each
// signature registered for BlueZ's signals of that shape.
#include <bluetooth/btbus.h>

#include "fuzz.h"

using namespace Bluetooth;

namespace {

size_t gTouched = 0;  // what the handlers read, so that a bad pointer shows

void onPath(RemoteObject*, const ObjectPath* path) { gTouched += path->str().size(); }
void onText(RemoteObject*, const char* text) { gTouched += std::string(text).size(); }
void onChange(RemoteObject*, const char* name, const Variant* value) {
    gTouched += std::string(name).size() + variantToString(*value).size();
}
void onFound(RemoteObject*, const char* address, const Dict* properties) {
    gTouched += std::string(address).size() + dictToString(*properties).size();
}
void onConnected(RemoteObject* object) { gTouched += object != 0; }

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static RemoteObject adapter("org.bluez", "/org/bluez/1/hci0", "org.bluez.Adapter", DBUS_BUS_SYSTEM);
    static RemoteObject sink("org.bluez", "/org/bluez/1/hci0/dev_00", "org.bluez.AudioSink", DBUS_BUS_SYSTEM);
    [[maybe_unused]] static bool listening = [] {  // no bus to ask for match rules: straight into the lists
        RemoteObject::signalHandlerVectorObjectPath.push_back({ &adapter, "DeviceCreated", &onPath });
        RemoteObject::signalHandlerVectorString.push_back({ &adapter, "DeviceDisappeared", &onText });
        RemoteObject::signalHandlerVectorStringVariant.push_back({ &adapter, "PropertyChanged", &onChange });
        RemoteObject::signalHandlerVectorStringDict.push_back({ &adapter, "DeviceFound", &onFound });
        RemoteObject::signalHandlerVectorNoArgument.push_back({ &sink, "Connected", &onConnected });
        return true;
    }();
    return fuzz::withMessage(data, size, [](DBusMessage* message) {
        RemoteObject::signalHandlerDispatcherObjectPath(&adapter, message);
        RemoteObject::signalHandlerDispatcherStringVariant(&adapter, message);
        RemoteObject::signalHandlerDispatcherString(&adapter, message);
        RemoteObject::signalHandlerDispatcherStringDict(&adapter, message);
        RemoteObject::signalHandlerDispatcherNoArgument(&adapter, message);
        fuzz::require(adapter.getErrorNumber() == 0 || adapter.getErrorNumber() == 4, "decoding errors are number 4");
        adapter.resetError();
    });
}
