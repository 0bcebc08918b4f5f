#ifndef BTBUS_BLUETOOTH_BTBUS_H
#define BTBUS_BLUETOOTH_BTBUS_H

// Every public header of btbus.
#include <bluetooth/connection.h>
#include <bluetooth/object_path.h>
#include <bluetooth/remote_object.h>
#include <bluetooth/util.h>
#include <bluetooth/variant.h>

#endif
