#include <bluetooth/control.h>

#include "bluez/signal_line.h"
#include "core/call.h"

BT_LOG_FILE("control.cpp");

namespace Bluetooth {

namespace {

const internal::Op kIsConnected = { "IsConnected", internal::kWaitReply, 60 };
const internal::Op kVolumeDown = { "VolumeDown", internal::kOneWay, 82 };
const internal::Op kVolumeUp = { "VolumeUp", internal::kOneWay, 105 };

enum { kConnected, kDisconnected };
const internal::SignalLine kSignals[] = {
    { "Connected", "Connected from ", "", "" },
    { "Disconnected", "Disconnected from ", "", "" },
};

}  // namespace

Control::Control(const char* path) : BluezObject(path, "org.bluez.Control") {}

// Before this class's part is gone: a handler may look at the whole object.
Control::~Control() { releaseHandlers(); }

Control* Control::getControl(const char* path) { return hasBluetoothd() ? new Control(path) : 0; }

int Control::isConnected(bool& connected) {
    return internal::call(*this, kLogFile, kIsConnected, &connected);
}

int Control::volumeDown() { return internal::call(*this, kLogFile, kVolumeDown, internal::kNoReply); }

int Control::volumeUp() { return internal::call(*this, kLogFile, kVolumeUp, internal::kNoReply); }

int Control::setConnectedHandler(ControlSignalHandler handler) {
    return setSignalHandlerNoArgument(kSignals[kConnected].signal,
                                      handler != 0 ? handler : &connectedHandler);
}

int Control::setDisconnectedHandler(ControlSignalHandler handler) {
    return setSignalHandlerNoArgument(kSignals[kDisconnected].signal,
                                      handler != 0 ? handler : &disconnectedHandler);
}

void Control::connectedHandler(RemoteObject* object) {
    internal::printLine(kSignals[kConnected], object);
}

void Control::disconnectedHandler(RemoteObject* object) {
    internal::printLine(kSignals[kDisconnected], object);
}

}  // namespace Bluetooth
