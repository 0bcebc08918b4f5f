#include <bluetooth/audio_sink.h>

#include "bluez/signal_line.h"
#include "core/call.h"

BT_LOG_FILE("audio_sink.cpp");

namespace Bluetooth {

namespace {

const internal::Op kConnect = { "Connect", internal::kOneWay, 58 };
const internal::Op kDisconnect = { "Disconnect", internal::kOneWay, 80 };
const internal::Op kIsConnected = { "IsConnected", internal::kWaitReply, 106 };

enum { kConnected, kDisconnected, kPlaying, kStopped };
const internal::SignalLine kSignals[] = {
    { "Connected", "Connected from ", "", "" },
    { "Disconnected", "Disconnected from ", "", "" },
    { "Playing", "Playing in ", "", "" },
    { "Stopped", "Stopped in ", "", "" },
};

}  // namespace

AudioSink::AudioSink(const char* path) : BluezObject(path, "org.bluez.AudioSink") {}

// Before this class's part is gone: a handler may look at the whole object.
AudioSink::~AudioSink() { releaseHandlers(); }

AudioSink* AudioSink::getAudioSink(const char* path) {
    return hasBluetoothd() ? new AudioSink(path) : 0;
}

int AudioSink::connect() { return internal::call(*this, kLogFile, kConnect, internal::kNoReply); }

int AudioSink::disconnect() {
    return internal::call(*this, kLogFile, kDisconnect, internal::kNoReply);
}

int AudioSink::isConnected(bool& connected) {
    return internal::call(*this, kLogFile, kIsConnected, &connected);
}

int AudioSink::setConnectedHandler(AudioSinkSignalHandler handler) {
    return setSignalHandlerNoArgument(kSignals[kConnected].signal,
                                      handler != 0 ? handler : &connectedHandler);
}

int AudioSink::setDisconnectedHandler(AudioSinkSignalHandler handler) {
    return setSignalHandlerNoArgument(kSignals[kDisconnected].signal,
                                      handler != 0 ? handler : &disconnectedHandler);
}

int AudioSink::setPlayingHandler(AudioSinkSignalHandler handler) {
    return setSignalHandlerNoArgument(kSignals[kPlaying].signal,
                                      handler != 0 ? handler : &playingHandler);
}

int AudioSink::setStoppedHandler(AudioSinkSignalHandler handler) {
    return setSignalHandlerNoArgument(kSignals[kStopped].signal,
                                      handler != 0 ? handler : &stoppedHandler);
}

void AudioSink::connectedHandler(RemoteObject* object) {
    internal::printLine(kSignals[kConnected], object);
}

void AudioSink::disconnectedHandler(RemoteObject* object) {
    internal::printLine(kSignals[kDisconnected], object);
}

void AudioSink::playingHandler(RemoteObject* object) {
    internal::printLine(kSignals[kPlaying], object);
}

void AudioSink::stoppedHandler(RemoteObject* object) {
    internal::printLine(kSignals[kStopped], object);
}

}  // namespace Bluetooth
