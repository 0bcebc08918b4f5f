#ifndef BTBUS_BLUETOOTH_AUDIO_H
#define BTBUS_BLUETOOTH_AUDIO_H

#include <bluetooth/bluez_object.h>

namespace Bluetooth {

/// Proxy for all audio profiles of one device ("org.bluez.Audio").
class Audio : public BluezObject {
public:
    /// A proxy for the device at path; no bus traffic.
    explicit Audio(const char* path);
    virtual ~Audio();

    /// A new Audio for path, or null when bluetoothd is not on the bus.
    static Audio* getAudio(const char* path);

    /// Send "Connect" / "Disconnect" without waiting; 0 when sent, else -1
    /// (logged).
    ///@{
    int connect();
    int disconnect();
    ///@}
};

}  // namespace Bluetooth

#endif
