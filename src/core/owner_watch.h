#ifndef BTBUS_SRC_CORE_OWNER_WATCH_H
#define BTBUS_SRC_CORE_OWNER_WATCH_H

#include <dbus/dbus.h>

namespace Bluetooth {

class RemoteObject;

namespace internal {

// Who owns a well-known name on a bus, followed through the bus daemon's
// "NameOwnerChanged": a daemon that leaves (owned false) and one that takes
// the name (owned true). A name handed straight from one owner to another is
// both, in that order.
typedef void (*OwnerFunction)(RemoteObject* object, bool owned);

// Calls function(&object, owned) on a receiving thread of object's bus each
// time name changes hands. 0, or -1 when the bus refuses the match rule
// (logged as "Match error (...)", as for signal handlers).
int watchOwner(RemoteObject& object, const char* name, OwnerFunction function);
// Ends object's watches and removes their match rules; a call running on
// another thread is waited for by the object's destruction, as for handlers.
void unwatchOwners(RemoteObject& object);
// Offers a message that the connection's loop dispatches to the watches.
void dispatchOwnerChange(DBusMessage* message);

}  // namespace internal
}  // namespace Bluetooth

#endif
