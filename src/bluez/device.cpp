#include <bluetooth/device.h>

#include <memory>

#include "bluez/signal_line.h"
#include "core/call.h"

BT_LOG_FILE("device.cpp");

namespace Bluetooth {

namespace {

const internal::Op kDiscoverServices = { "DiscoverServices", internal::kWaitReply, 64 };
const internal::Op kCancelDiscovery = { "CancelDiscovery", internal::kOneWay, 85 };

const internal::SignalLine kDisconnectRequested = { "DisconnectRequested",
                                                    "Disconnect requested from ", "", "" };

}  // namespace

Device::Device(const char* path) : BluezObject(path, "org.bluez.Device") {}

// Before this class's part is gone: a handler may look at the whole object.
Device::~Device() { releaseHandlers(); }

Device* Device::getDevice(const char* path) { return hasBluetoothd() ? new Device(path) : 0; }

Dict* Device::discoverServices(const char* pattern) {
    std::unique_ptr<Dict> services(new Dict);
    if (internal::call(*this, kLogFile, kDiscoverServices, services.get(), pattern) != 0) return 0;
    return services.release();
}

int Device::cancelDiscovery() {
    return internal::call(*this, kLogFile, kCancelDiscovery, internal::kNoReply);
}

int Device::setDisconnectRequestedHandler(DeviceSignalHandler handler) {
    return setSignalHandlerNoArgument(kDisconnectRequested.signal,
                                      handler != 0 ? handler : &disconnectRequestedHandler);
}

void Device::disconnectRequestedHandler(RemoteObject* object) {
    internal::printLine(kDisconnectRequested, object);
}

}  // namespace Bluetooth
