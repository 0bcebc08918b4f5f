#include <bluetooth/audio.h>

#include "core/call.h"

BT_LOG_FILE("audio.cpp");

namespace Bluetooth {

namespace {
const internal::Op kConnect = { "Connect", internal::kOneWay, 51 };
const internal::Op kDisconnect = { "Disconnect", internal::kOneWay, 73 };
}  // namespace

Audio::Audio(const char* path) : BluezObject(path, "org.bluez.Audio") {}

// Before this class's part is gone: a handler may look at the whole object.
Audio::~Audio() { releaseHandlers(); }

Audio* Audio::getAudio(const char* path) { return hasBluetoothd() ? new Audio(path) : 0; }

int Audio::connect() { return internal::call(*this, kLogFile, kConnect, internal::kNoReply); }

int Audio::disconnect() { return internal::call(*this, kLogFile, kDisconnect, internal::kNoReply); }

}  // namespace Bluetooth
