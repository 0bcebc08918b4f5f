#include <bluetooth/bluez_object.h>

#include <algorithm>
#include <memory>

#include <bluetooth/dbus_object.h>
#include <bluetooth/util.h>

#include "bluez/signal_line.h"
#include "core/call.h"

BT_LOG_FILE("bluez_object.cpp");

namespace Bluetooth {

namespace {

using internal::Op;

const Op kGetProperties = { "GetProperties", internal::kWaitReply, 77 };
const Op kSetProperty = { "SetProperty", internal::kOneWay, 107 };

const internal::SignalLine kPropertyChanged = { "PropertyChanged", "", " was changed in ",
                                                " with " };

}  // namespace

BluezObject::BluezObject(const char* path, const char* interface)
    : RemoteObject("org.bluez", path, interface, DBUS_BUS_SYSTEM) {}

// Before this class's part is gone: a handler may look at the whole object.
BluezObject::~BluezObject() { releaseHandlers(); }

Dict* BluezObject::getProperties() {
    std::unique_ptr<Dict> properties(new Dict);
    if (internal::call(*this, kLogFile, kGetProperties, properties.get()) != 0) return 0;
    return properties.release();
}

int BluezObject::setProperty(const char* name, const Variant& value) {
    return internal::call(*this, kLogFile, kSetProperty, internal::kNoReply, name, value);
}

int BluezObject::setPropertyChangedHandler(PropertyChangedHandler handler) {
    return setSignalHandlerStringVariant(kPropertyChanged.signal,
                                         handler != 0 ? handler : &propertyChangedHandler);
}

void BluezObject::propertyChangedHandler(RemoteObject* object, const char* name,
                                         const Variant* value) {
    std::string text;
    if (value != 0) text = variantToString(*value);
    internal::printLine(kPropertyChanged, name, object, value != 0 ? text.c_str() : 0);
}

bool BluezObject::hasBluetoothd() {
    DBusObject bus;
    std::unique_ptr<std::vector<std::string> > names(bus.listNames());
    if (!names) return false;
    return std::find(names->begin(), names->end(), "org.bluez") != names->end();
}

}  // namespace Bluetooth
