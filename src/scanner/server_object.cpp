#include <bluetooth/server_object.h>

#include <iostream>
#include <mutex>

#include <dbus/dbus-glib-lowlevel.h>

#include <bluetooth/scanner_server.h>

#include "core/log.h"
#include "scanner/guarded.h"

BT_LOG_FILE("server_object.cpp");

namespace Bluetooth {

namespace {

const int kAcquireLogLine = 71;
const guint kTickMs = 1000;

// Guards every object's loop field: quitLoop and a second startLoop may come
// from other threads while the loop starts or ends.
std::mutex gLoopLock;

// Frees a GError on every path.
class ScopedGError {
public:
    ScopedGError() : error_(0) {}
    ~ScopedGError() {
        if (error_ != 0) g_error_free(error_);
    }
    GError** out() { return &error_; }
    const char* text() const { return error_ != 0 && error_->message ? error_->message : ""; }

    ScopedGError(const ScopedGError&) = delete;
    ScopedGError& operator=(const ScopedGError&) = delete;

private:
    GError* error_;
};

// Writing a null text fails the stream, as inserting a null char* would.
void printLine(const char* label, const char* text) {
    std::cout << label;
    if (text != 0)
        std::cout << text << std::endl;
    else
        std::cout.setstate(std::ios::badbit);
}

}  // namespace

ServerObject::ServerObject(const char* busName, const char* path, DBusBusType busType)
    : loop(0), proxy(0), connection(0), busType(busType), busName(busName), path(path) {
    getConnection();
    if (connection != 0)
        proxy = dbus_g_proxy_new_for_name(connection, "org.freedesktop.DBus",
                                          "/org/freedesktop/DBus", "org.freedesktop.DBus");
}

ServerObject::~ServerObject() {
    if (proxy != 0) g_object_unref(proxy);
}

bool ServerObject::callbackThreadHandler(void*) { return true; }

DBusGConnection* ServerObject::getConnection() {
    if (connection != 0) return connection;
    ScopedGError error;
    connection = dbus_g_bus_get(busType, error.out());
    return connection;
}

bool ServerObject::prepareObjectInfo(GType type, const DBusGObjectInfo* info, GObject* object) {
    dbus_g_object_type_install_info(type, info);
    ScopedGError error;
    guint result = 0;
    // The answer is not looked at: being queued behind another owner is fine.
    if (proxy == 0 ||
        !dbus_g_proxy_call(proxy, "RequestName", error.out(), G_TYPE_STRING, busName, G_TYPE_UINT,
                           0u, G_TYPE_INVALID, G_TYPE_UINT, &result, G_TYPE_INVALID)) {
        internal::logError(kLogFile, kAcquireLogLine, "Failed to acquire %s, %s",
                           busName != 0 ? busName : "", proxy != 0 ? error.text() : "no connection");
        return false;
    }
    dbus_g_connection_register_g_object(connection, path, object);
    return true;
}

void ServerObject::startLoop() {
    ScannerServer* scanner = dynamic_cast<ScannerServer*>(this);
    if (scanner == 0) return;
    GMainLoop* running = 0;
    {
        std::lock_guard<std::mutex> hold(gLoopLock);
        if (loop != 0) return;
        running = loop = g_main_loop_new(NULL, FALSE);
    }
    if (scanner->manager != 0) scanner->manager->startLoop();
    dbus_g_thread_init();
    guint timer = g_timeout_add(kTickMs, &updateTimer, this);
    g_main_loop_run(running);
    // A loop quit from elsewhere leaves the timer; it must not tick into a
    // destroyed object.
    GSource* source = g_main_context_find_source_by_id(NULL, timer);
    if (source != 0) g_source_destroy(source);
    {
        std::lock_guard<std::mutex> hold(gLoopLock);
        loop = 0;
    }
    g_main_loop_unref(running);
    if (scanner->manager != 0) {
        scanner->manager->stopLoop();
        // Joined, so that the destructor can delete the Manager.
        scanner->manager->waitLoop();
    }
}

void ServerObject::quitLoop() {
    std::lock_guard<std::mutex> hold(gLoopLock);
    if (loop != 0) g_main_loop_quit(loop);
}

void ServerObject::printInfo() const {
    printLine("ServerObject name: ", getBusName());
    printLine("Path: ", getPath());
    printLine("Interface: ", getInterface());
}

const char* ServerObject::getConnectionName() const {
    if (connection == 0) return 0;
    return dbus_bus_get_unique_name(dbus_g_connection_get_connection(connection));
}

const char* ServerObject::getBusName() const {
    return proxy != 0 ? dbus_g_proxy_get_bus_name(proxy) : 0;
}

const char* ServerObject::getPath() const { return proxy != 0 ? dbus_g_proxy_get_path(proxy) : 0; }

const char* ServerObject::getInterface() const {
    return proxy != 0 ? dbus_g_proxy_get_interface(proxy) : 0;
}

gboolean updateTimer(void* data) {
    bool keep = true;  // a hook that throws keeps its timer
    internal::guarded(kLogFile, __LINE__, "Timer tick",
                      [&] { keep = static_cast<ServerObject*>(data)->callbackThreadHandler(data); });
    return keep ? TRUE : FALSE;
}

}  // namespace Bluetooth
