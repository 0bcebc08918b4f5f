#ifndef BTBUS_SRC_CORE_DBUS_HOLDERS_H
#define BTBUS_SRC_CORE_DBUS_HOLDERS_H

#include <memory>

#include <dbus/dbus.h>

namespace Bluetooth {
namespace internal {

struct MessageUnref {
    void operator()(DBusMessage* message) const {
        if (message != 0) dbus_message_unref(message);
    }
};
typedef std::unique_ptr<DBusMessage, MessageUnref> MessagePtr;

class ScopedError {  // dbus_error_free is safe on an unset error
public:
    ScopedError() { dbus_error_init(&error_); }
    ~ScopedError() { dbus_error_free(&error_); }
    DBusError* get() { return &error_; }
    bool isSet() const { return dbus_error_is_set(&error_); }
    const char* name() const { return isSet() && error_.name ? error_.name : ""; }
    const char* text() const { return isSet() && error_.message ? error_.message : ""; }

    ScopedError(const ScopedError&) = delete;
    ScopedError& operator=(const ScopedError&) = delete;

private:
    DBusError error_;
};

// Opens a container on construction; close() commits it, and the destructor
// abandons one that was not closed, so a failed append leaves nothing half-built.
class OpenContainer {
public:
    OpenContainer(DBusMessageIter& parent, int type, const char* signature)
        : parent_(parent), open_(dbus_message_iter_open_container(&parent, type, signature, &child_)) {}
    ~OpenContainer() {
        if (open_) dbus_message_iter_abandon_container(&parent_, &child_);
    }
    bool isOpen() const { return open_; }
    DBusMessageIter* iterator() { return &child_; }
    bool close() {
        if (!open_) return false;
        open_ = false;
        return dbus_message_iter_close_container(&parent_, &child_);
    }

    OpenContainer(const OpenContainer&) = delete;
    OpenContainer& operator=(const OpenContainer&) = delete;

private:
    DBusMessageIter& parent_;
    DBusMessageIter child_;
    bool open_;
};

}  // namespace internal
}  // namespace Bluetooth

#endif
