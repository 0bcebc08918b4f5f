#ifndef BTBUS_TESTS_INTEGRATION_SCANNER_SCANNER_PEER_H
#define BTBUS_TESTS_INTEGRATION_SCANNER_SCANNER_PEER_H

#include <csignal>
#include <cstdio>
#include <map>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "core/dbus_holders.h"
#include "support/process.h"
#include "support/sim.h"

namespace btbus_test {

constexpr const char* kScannerName = "com.quillmar.bluetooth";
constexpr const char* kScannerInterface = "com.quillmar.bluetooth.Scanner";

// btbus-scanner started by the test with args; stop() ends it with SIGTERM and
// returns its wait status (0: exited with 0).
class Daemon {
public:
    explicit Daemon(const std::vector<std::string>& args = {}) {
        std::vector<std::string> argv = { BTBUS_SCANNER };
        argv.insert(argv.end(), args.begin(), args.end());
        argv = targetCommand(argv);
        pid_ = spawn(argv);
        EXPECT_TRUE(waitForName(DBUS_BUS_SESSION, kScannerName));
    }
    ~Daemon() { stop(); }
    int stop() {
        if (pid_ <= 0) return -1;
        int status = btbus_test::stop(pid_, SIGTERM, 10000ms);
        pid_ = -1;
        waitUntil([] { return !nameHasOwner(DBUS_BUS_SESSION, kScannerName); });
        return status;
    }

private:
    pid_t pid_ = -1;
};

// A call with one string argument on a private session connection, so that
// the library's shared one is not involved; null on failure (error set).
inline Bluetooth::internal::MessagePtr callOnSession(const char* destination, const char* path,
                                                     const char* interface, const char* method,
                                                     const std::string& argument,
                                                     Bluetooth::internal::ScopedError& error) {
    DBusConnection* connection = dbus_bus_get_private(DBUS_BUS_SESSION, error.get());
    if (connection == nullptr) return nullptr;
    dbus_connection_set_exit_on_disconnect(connection, FALSE);
    Bluetooth::internal::MessagePtr call(dbus_message_new_method_call(destination, path, interface, method));
    const char* text = argument.c_str();
    dbus_message_append_args(call.get(), DBUS_TYPE_STRING, &text, DBUS_TYPE_INVALID);
    Bluetooth::internal::MessagePtr reply(
        dbus_connection_send_with_reply_and_block(connection, call.get(), -1, error.get()));
    dbus_connection_close(connection);
    dbus_connection_unref(connection);
    return reply;
}

// The scanner's a{ss} answer in full (the empty key included) or its error.
struct Answer {
    std::map<std::string, std::string> devices;
    std::string errorName, error;
};

inline Answer callScanner(const char* method, const std::string& argument) {
    Bluetooth::internal::ScopedError error;
    Bluetooth::internal::MessagePtr reply = callOnSession(kScannerName, "/", kScannerInterface, method, argument, error);
    Answer answer{ {}, error.name(), error.text() };
    DBusMessageIter args, array, entry;
    if (reply && dbus_message_iter_init(reply.get(), &args) &&
        dbus_message_iter_get_arg_type(&args) == DBUS_TYPE_ARRAY) {
        for (dbus_message_iter_recurse(&args, &array); dbus_message_iter_get_arg_type(&array) != DBUS_TYPE_INVALID;
             dbus_message_iter_next(&array)) {
            const char *key = "", *value = "";
            dbus_message_iter_recurse(&array, &entry);
            dbus_message_iter_get_basic(&entry, &key);
            dbus_message_iter_next(&entry);
            dbus_message_iter_get_basic(&entry, &value);
            answer.devices[key] = value;
        }
    }
    return answer;
}

// DeviceFound from adapterPath; props is the a{sv} as the simulator's JSON.
inline void found(const std::string& adapterPath, const std::string& address, const std::string& props) {
    sim::emitSignal(adapterPath, "org.bluez.Adapter", "DeviceFound", "sa{sv}",
                    "[\"" + address + "\", " + props + "]");
}

// Standard output and error of a shell command.
inline std::string shell(const std::string& command) {
    std::string output;
    FILE* pipe = popen((command + " 2>&1").c_str(), "r");
    if (pipe == nullptr) return output;
    char buffer[4096];
    for (size_t n; (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;) output.append(buffer, n);
    pclose(pipe);
    return output;
}

}  // namespace btbus_test

#endif
