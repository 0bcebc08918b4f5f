#ifndef BTBUS_BLUETOOTH_BLUEZ_OBJECT_H
#define BTBUS_BLUETOOTH_BLUEZ_OBJECT_H

#include <bluetooth/remote_object.h>
#include <bluetooth/variant.h>

namespace Bluetooth {

/// Handler of "PropertyChanged": the registering proxy, the property's name and
/// its new value (both owned by the dispatcher, valid during the call only).
typedef void (*PropertyChangedHandler)(RemoteObject* object, const char* name,
                                       const Variant* value);

/// Base of every BlueZ proxy: bus name "org.bluez" on the system bus, with the
/// "GetProperties", "SetProperty" and "PropertyChanged" members that all BlueZ 4
/// interfaces share.
class BluezObject : public RemoteObject {
public:
    /// A proxy for interface at path of "org.bluez", on the system bus.
    BluezObject(const char* path, const char* interface);
    virtual ~BluezObject();

    /// Calls "GetProperties" and returns the properties as a new Dict owned by
    /// the caller, or null on failure (logged once).
    virtual Dict* getProperties();

    /// Sends "SetProperty"(name, value) without waiting for the reply: 0 when it
    /// was sent, -1 when it could not be built or sent (logged once). A refusal
    /// by bluetoothd is not seen.
    int setProperty(const char* name, const Variant& value);

    /// Registers handler for "PropertyChanged"; null installs
    /// propertyChangedHandler. Returns the registration's result (0 or -1).
    int setPropertyChangedHandler(PropertyChangedHandler handler);

    /// Prints "<name> was changed in <path> with <value>" and flushes.
    static void propertyChangedHandler(RemoteObject* object, const char* name,
                                       const Variant* value);

    /// Whether "org.bluez" is owned on the system bus (one "ListNames" call per
    /// call; false when the bus cannot be asked).
    static bool hasBluetoothd();
};

}  // namespace Bluetooth

#endif
