#ifndef BTBUS_BLUETOOTH_BTBUS_H
#define BTBUS_BLUETOOTH_BTBUS_H

/// Every public header of btbus.
#include <bluetooth/adapter.h>
#include <bluetooth/agent.h>
#include <bluetooth/audio.h>
#include <bluetooth/audio_sink.h>
#include <bluetooth/auto_connect.h>
#include <bluetooth/bluez_object.h>
#include <bluetooth/connection.h>
#include <bluetooth/control.h>
#include <bluetooth/dbus_object.h>
#include <bluetooth/device.h>
#include <bluetooth/fifo.h>
#include <bluetooth/manager.h>
#include <bluetooth/object_path.h>
#include <bluetooth/remote_object.h>
#include <bluetooth/scanner.h>
#include <bluetooth/scanner_server.h>
#include <bluetooth/server_object.h>
#include <bluetooth/util.h>
#include <bluetooth/variant.h>
#include <bluetooth/version.h>

#endif
