// Measures btbus-scanner's "ListDevices" on private buses against a native
// BlueZ peer (this process): latency (median, 99th percentile) and the daemon's
// resident memory with 100, 1,000 and 10,000 found devices beside 100 devices
// that BlueZ holds as objects; the share of the filter that every call rebuilds
// (one "ListNames" per device object, from the proxy factories); and the
// daemon's memory across repeated DeviceFound of the same devices.
// Usage: btbus-bench-scanner [calls per case]
#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include <dbus/dbus.h>

#include "private_bus.h"

namespace {

using Clock = std::chrono::steady_clock;
const char kAdapter[] = "/org/bluez/1/hci0";

std::atomic<int> gHeld(0);  // device objects that ListDevices of the peer reports
std::atomic<bool> gStop(false);

std::string deviceAddress(int prefix, int i) {
    char text[18];
    std::snprintf(text, sizeof text, "%02X:00:00:%02X:%02X:%02X", prefix, (i >> 16) & 255, (i >> 8) & 255, i & 255);
    return text;
}

std::string devicePath(int i) {
    std::string path = std::string(kAdapter) + "/dev_" + deviceAddress(0x10, i);
    std::replace(path.begin(), path.end(), ':', '_');
    return path;
}

void replyPaths(DBusConnection* connection, DBusMessage* call, const std::vector<std::string>& paths) {
    DBusMessage* reply = dbus_message_new_method_return(call);
    DBusMessageIter args, array;
    dbus_message_iter_init_append(reply, &args);
    dbus_message_iter_open_container(&args, DBUS_TYPE_ARRAY, "o", &array);
    for (const std::string& path : paths) {
        const char* text = path.c_str();
        dbus_message_iter_append_basic(&array, DBUS_TYPE_OBJECT_PATH, &text);
    }
    dbus_message_iter_close_container(&args, &array);
    dbus_connection_send(connection, reply, nullptr);
    dbus_message_unref(reply);
}

// The BlueZ methods the scanner uses: one adapter, gHeld device objects.
DBusHandlerResult serveBluez(DBusConnection* connection, DBusMessage* call, void*) {
    if (dbus_message_get_type(call) != DBUS_MESSAGE_TYPE_METHOD_CALL) return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
    if (dbus_message_is_method_call(call, "org.bluez.Manager", "FindAdapter")) {
        // Any name is an adapter: "hci1" keeps the daemon from its idle exit.
        const char* name = "";
        dbus_message_get_args(call, nullptr, DBUS_TYPE_STRING, &name, DBUS_TYPE_INVALID);
        std::string path = std::string(kAdapter, sizeof kAdapter - 5) + name;
        const char* text = path.c_str();
        DBusMessage* reply = dbus_message_new_method_return(call);
        dbus_message_append_args(reply, DBUS_TYPE_OBJECT_PATH, &text, DBUS_TYPE_INVALID);
        dbus_connection_send(connection, reply, nullptr);
        dbus_message_unref(reply);
    } else if (dbus_message_is_method_call(call, "org.bluez.Manager", "ListAdapters")) {
        replyPaths(connection, call, { kAdapter });
    } else if (dbus_message_is_method_call(call, "org.bluez.Adapter", "ListDevices")) {
        std::vector<std::string> paths;
        for (int i = 0; i < gHeld; ++i) paths.push_back(devicePath(i));
        replyPaths(connection, call, paths);
    } else {
        // StartDiscovery, StopDiscovery and whatever else: an empty answer.
        DBusMessage* reply = dbus_message_new_method_return(call);
        dbus_connection_send(connection, reply, nullptr);
        dbus_message_unref(reply);
    }
    return DBUS_HANDLER_RESULT_HANDLED;
}

void servePeer(DBusConnection* peer) {
    while (!gStop) dbus_connection_read_write_dispatch(peer, 100);
}

DBusConnection* connect(DBusBusType type) {
    DBusConnection* connection = dbus_bus_get_private(type, nullptr);
    if (connection != nullptr) dbus_connection_set_exit_on_disconnect(connection, FALSE);
    return connection;
}

void emitFound(DBusConnection* emitter, const std::string& address) {
    DBusMessage* signal = dbus_message_new_signal(kAdapter, "org.bluez.Adapter", "DeviceFound");
    DBusMessageIter args, dict;
    const char* text = address.c_str();
    dbus_message_iter_init_append(signal, &args);
    dbus_message_iter_append_basic(&args, DBUS_TYPE_STRING, &text);
    dbus_message_iter_open_container(&args, DBUS_TYPE_ARRAY, "{sv}", &dict);
    auto put = [&dict](const char* key, int type, const void* value) {
        DBusMessageIter entry, variant;
        char signature[2] = { static_cast<char>(type), '\0' };
        dbus_message_iter_open_container(&dict, DBUS_TYPE_DICT_ENTRY, nullptr, &entry);
        dbus_message_iter_append_basic(&entry, DBUS_TYPE_STRING, &key);
        dbus_message_iter_open_container(&entry, DBUS_TYPE_VARIANT, signature, &variant);
        dbus_message_iter_append_basic(&variant, type, value);
        dbus_message_iter_close_container(&entry, &variant);
        dbus_message_iter_close_container(&dict, &entry);
    };
    const char* name = "Bench Device";
    dbus_uint32_t deviceClass = 0x5a020c;
    dbus_int16_t rssi = -60;
    dbus_bool_t no = FALSE;
    put("Address", DBUS_TYPE_STRING, &text);
    put("Class", DBUS_TYPE_UINT32, &deviceClass);
    put("RSSI", DBUS_TYPE_INT16, &rssi);
    put("Name", DBUS_TYPE_STRING, &name);
    put("Alias", DBUS_TYPE_STRING, &name);
    put("LegacyPairing", DBUS_TYPE_BOOLEAN, &no);
    put("Paired", DBUS_TYPE_BOOLEAN, &no);
    dbus_message_iter_close_container(&args, &dict);
    dbus_connection_send(emitter, signal, nullptr);
    dbus_message_unref(signal);
}

// One call of the scanner: its latency in milliseconds and the entries
// answered (-1: an error).
double callScanner(DBusConnection* client, const char* method, int* entries, const char* adapter = "hci0") {
    DBusMessage* call = dbus_message_new_method_call("com.quillmar.bluetooth", "/", "com.quillmar.bluetooth.Scanner",
                                                     method);
    dbus_message_append_args(call, DBUS_TYPE_STRING, &adapter, DBUS_TYPE_INVALID);
    Clock::time_point start = Clock::now();
    DBusMessage* reply = dbus_connection_send_with_reply_and_block(client, call, -1, nullptr);
    double ms = std::chrono::duration<double, std::milli>(Clock::now() - start).count();
    dbus_message_unref(call);
    *entries = -1;
    DBusMessageIter args, array;
    if (reply != nullptr) *entries = 0;
    if (reply != nullptr && dbus_message_iter_init(reply, &args)) {
        *entries = 0;
        for (dbus_message_iter_recurse(&args, &array); dbus_message_iter_get_arg_type(&array) != DBUS_TYPE_INVALID;
             dbus_message_iter_next(&array))
            ++*entries;
    }
    if (reply != nullptr) dbus_message_unref(reply);
    return ms;
}

double listDevices(DBusConnection* client, int* entries) { return callScanner(client, "ListDevices", entries); }

// A "Vm...:" figure of the daemon's /proc status, in MiB: VmRSS now, VmHWM at
// its peak.
double memoryMiB(pid_t pid, const std::string& field) {
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    while (std::getline(status, line))
        if (line.compare(0, field.size(), field) == 0) return std::atof(line.c_str() + field.size() + 1) / 1024.0;
    return -1;
}

// Emits DeviceFound for devices [0, count) and the round's marker, and waits
// until the daemon lists them all (with the markers of earlier rounds). A new
// finder for hci1 first keeps the daemon from its idle exit. The emitter is a
// connection of its own: flushing the peer's would wait for its dispatcher.
bool emitAndSettle(DBusConnection* emitter, DBusConnection* client, int count, int round) {
    int entries = 0;
    callScanner(client, "RemoveFinder", &entries, "hci1");
    callScanner(client, "ListDevices", &entries, "hci1");
    for (int i = 0; i < count; ++i) {
        emitFound(emitter, deviceAddress(0x20, i));
        if (i % 256 == 0) dbus_connection_flush(emitter);
    }
    emitFound(emitter, deviceAddress(0x30, round));
    dbus_connection_flush(emitter);
    Clock::time_point deadline = Clock::now() + std::chrono::seconds(25);
    while (Clock::now() < deadline) {
        listDevices(client, &entries);
        if (entries == count + round + 1) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return false;
}

struct Figures {
    double median, p99;
};

Figures figures(std::vector<double> ms) {
    std::sort(ms.begin(), ms.end());
    return { ms[ms.size() / 2], ms[std::min(ms.size() - 1, ms.size() * 99 / 100)] };
}

Figures measure(DBusConnection* client, int calls) {
    std::vector<double> ms;
    int entries = 0;
    for (int i = 0; i < calls; ++i) ms.push_back(listDevices(client, &entries));
    return figures(ms);
}

// One "ListNames" round trip, the check every proxy factory makes.
Figures listNames(DBusConnection* connection, int calls) {
    std::vector<double> ms;
    for (int i = 0; i < calls; ++i) {
        DBusMessage* call = dbus_message_new_method_call("org.freedesktop.DBus", "/org/freedesktop/DBus",
                                                         "org.freedesktop.DBus", "ListNames");
        Clock::time_point start = Clock::now();
        DBusMessage* reply = dbus_connection_send_with_reply_and_block(connection, call, -1, nullptr);
        ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - start).count());
        dbus_message_unref(call);
        if (reply != nullptr) dbus_message_unref(reply);
    }
    return figures(ms);
}

}  // namespace

int main(int argc, char** argv) {
    int calls = argc > 1 ? std::atoi(argv[1]) : 200;
    pid_t systemBus = -1, sessionBus = -1;
    std::string system = btbus_bench::startBus("bench-system", &systemBus);
    std::string session = btbus_bench::startBus("bench-session", &sessionBus);
    setenv("DBUS_SYSTEM_BUS_ADDRESS", system.c_str(), 1);
    setenv("DBUS_SESSION_BUS_ADDRESS", session.c_str(), 1);
    DBusConnection* peer = system.empty() ? nullptr : connect(DBUS_BUS_SYSTEM);
    DBusConnection* emitter = system.empty() ? nullptr : connect(DBUS_BUS_SYSTEM);
    DBusConnection* client = session.empty() ? nullptr : connect(DBUS_BUS_SESSION);
    if (peer == nullptr || emitter == nullptr || client == nullptr) {
        std::fprintf(stderr, "cannot start or reach the private buses\n");
        btbus_bench::stopBus(systemBus);
        btbus_bench::stopBus(sessionBus);
        return 1;
    }
    dbus_bus_request_name(peer, "org.bluez", 0, nullptr);
    dbus_connection_add_filter(peer, &serveBluez, nullptr, nullptr);
    std::thread peerThread(servePeer, peer);

    pid_t daemon = -1;
    char* daemonArgv[] = { const_cast<char*>(BTBUS_SCANNER), nullptr };
    int result = 1;
    if (posix_spawn(&daemon, BTBUS_SCANNER, nullptr, nullptr, daemonArgv, environ) == 0) {
        int entries = 0;
        Clock::time_point deadline = Clock::now() + std::chrono::seconds(10);
        while (listDevices(client, &entries) >= 0 && entries < 0 && Clock::now() < deadline)
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
        std::printf("btbus-scanner ListDevices, %d calls per case (a quarter at 10,000)\n\n", calls);
        std::printf("%8s %6s %11s %9s %9s %9s\n", "found", "held", "median ms", "p99 ms", "RSS MiB", "peak MiB");
        int round = 0;
        bool settled = true;
        for (int found : { 100, 1000, 10000 }) {
            settled = settled && emitAndSettle(emitter, client, found, round++);
            for (int held : { 100, 0 }) {
                gHeld = held;
                Figures f = measure(client, found == 10000 ? calls / 4 : calls);
                std::printf("%8d %6d %11.2f %9.2f %9.1f %9.1f\n", found, held, f.median, f.p99,
                            memoryMiB(daemon, "VmRSS"), memoryMiB(daemon, "VmHWM"));
            }
        }
        gHeld = 100;
        std::printf("\nRSS after the same 10,000 devices are found again, three times:");
        for (int again = 0; again < 3; ++again) {
            settled = settled && emitAndSettle(emitter, client, 10000, round++);
            std::printf(" %.1f", memoryMiB(daemon, "VmRSS"));
        }
        std::printf(" MiB\n");
        std::printf("\nThe held rows differ by the filter, rebuilt at every call: ListAdapters, ListDevices\n"
                    "and one ListNames for each proxy the factories make (adapter and 100 devices);\n"
                    "one ListNames round trip from this process takes %.3f ms (median).\n",
                    listNames(emitter, calls).median);
        if (!settled) std::printf("(the daemon did not take every signal in time)\n");
        result = settled ? 0 : 1;
        int status = 0;
        if (waitpid(daemon, &status, WNOHANG) == daemon) {
            std::printf("btbus-scanner ended early, wait status %d\n", status);
            result = 1;
        } else {
            kill(daemon, SIGTERM);
            waitpid(daemon, nullptr, 0);
        }
    }
    gStop = true;
    peerThread.join();
    dbus_connection_close(peer);
    dbus_connection_unref(peer);
    for (DBusConnection* connection : { emitter, client }) {
        dbus_connection_close(connection);
        dbus_connection_unref(connection);
    }
    btbus_bench::stopBus(systemBus);
    btbus_bench::stopBus(sessionBus);
    return result;
}
