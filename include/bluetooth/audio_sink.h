#ifndef BTBUS_BLUETOOTH_AUDIO_SINK_H
#define BTBUS_BLUETOOTH_AUDIO_SINK_H

#include <bluetooth/bluez_object.h>

namespace Bluetooth {

/// Handler of the sink's argument-less signals: called with the proxy whose
/// receiving thread runs, not necessarily the one that registered it.
typedef void (*AudioSinkSignalHandler)(RemoteObject* object);

/// Proxy for the A2DP sink of one device ("org.bluez.AudioSink").
class AudioSink : public BluezObject {
public:
    /// A proxy for the device at path; no bus traffic.
    explicit AudioSink(const char* path);
    virtual ~AudioSink();

    /// A new AudioSink for path, or null when bluetoothd is not on the bus.
    static AudioSink* getAudioSink(const char* path);

    /// Send "Connect" / "Disconnect" without waiting; 0 when sent, else -1
    /// (logged).
    ///@{
    int connect();
    int disconnect();
    ///@}
    /// "IsConnected": 0 with the answer in connected (untouched on failure), or
    /// -1 (logged).
    int isConnected(bool& connected);

    /// Register handlers for "Connected", "Disconnected", "Playing" and
    /// "Stopped"; null installs the default handler below.
    ///@{
    int setConnectedHandler(AudioSinkSignalHandler handler);
    int setDisconnectedHandler(AudioSinkSignalHandler handler);
    int setPlayingHandler(AudioSinkSignalHandler handler);
    int setStoppedHandler(AudioSinkSignalHandler handler);
    ///@}

    static void connectedHandler(RemoteObject* object);     ///< "Connected from <path>"
    static void disconnectedHandler(RemoteObject* object);  ///< "Disconnected from <path>"
    static void playingHandler(RemoteObject* object);       ///< "Playing in <path>"
    static void stoppedHandler(RemoteObject* object);       ///< "Stopped in <path>"
};

}  // namespace Bluetooth

#endif
