// Measures the receiving thread on a private dbus-daemon, in one run:
//  1. latency from an idle loop to the handler, for the library's loop and for
//     a loop that sleeps 100 ms whenever nothing is queued;
//  2. the cost of blocking calls while each of those loops runs, as a ratio to
//     the same calls made with raw libdbus and no loop at all.
//  3. decoding a 12-entry GetProperties reply into a Dict, as a ratio to a raw
//     iterator walk that reads every value;
//  4. how often an idle receiving thread wakes up;
//  5. one-way calls, and receiving 100,000 DeviceFound-like signals, each as a
//     ratio to raw libdbus.
// Run it pinned to one CPU (make bench does) for steady ratios.
// Usage: btbus-bench-loop [signals] [calls]
#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include <fcntl.h>
#include <sys/resource.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <bluetooth/remote_object.h>

#include "private_bus.h"

extern char** environ;

namespace {

using Clock = std::chrono::steady_clock;
const char* const kService = "org.btbus.Bench";
const char* const kPath = "/org/btbus/Bench";
const char* const kInterface = "org.btbus.Bench";

double nowMicros() {
    return std::chrono::duration<double, std::micro>(Clock::now().time_since_epoch()).count();
}

// ---- a private bus for the run ----

pid_t gDaemon = -1;

std::string startBus() { return btbus_bench::startBus("bench", &gDaemon); }

void stopBus() { btbus_bench::stopBus(gDaemon); }

DBusConnection* privateConnection() {
    DBusConnection* connection = dbus_bus_get_private(DBUS_BUS_SESSION, nullptr);
    if (connection != nullptr) dbus_connection_set_exit_on_disconnect(connection, FALSE);
    return connection;
}

// ---- the peer: answers Echo and emits Stamp signals, on its own connection ----

std::atomic<bool> gPeerStop{ false };

void servePeer(DBusConnection* connection) {
    while (!gPeerStop) {
        dbus_connection_read_write(connection, 20);
        while (DBusMessage* message = dbus_connection_pop_message(connection)) {
            if (dbus_message_is_method_call(message, kInterface, "Echo") && !dbus_message_get_no_reply(message)) {
                DBusMessage* reply = dbus_message_new_method_return(message);
                dbus_connection_send(connection, reply, nullptr);
                dbus_message_unref(reply);
            }
            dbus_message_unref(message);
        }
        dbus_connection_flush(connection);
    }
}

void emitStamp(DBusConnection* connection) {
    std::string stamp = std::to_string(nowMicros());
    const char* text = stamp.c_str();
    DBusMessage* signal = dbus_message_new_signal(kPath, kInterface, "Stamp");
    dbus_message_append_args(signal, DBUS_TYPE_STRING, &text, DBUS_TYPE_INVALID);
    dbus_connection_send(connection, signal, nullptr);
    dbus_connection_flush(connection);
    dbus_message_unref(signal);
}

// ---- what a receiver records ----

std::vector<double> gLatencies;
std::atomic<int> gReceived{ 0 };

void onStamp(Bluetooth::RemoteObject*, const char* stamp) {
    gLatencies.push_back(nowMicros() - std::atof(stamp));
    ++gReceived;
}

// The loop that sleeps blindly: it looks at the head of the queue, takes only
// signals (taking replies would starve the caller), and sleeps 100 ms when
// nothing is queued.
std::atomic<bool> gBlindStop{ false };

void blindLoop(DBusConnection* connection) {
    while (!gBlindStop) {
        dbus_connection_read_write(connection, 0);
        DBusMessage* message = dbus_connection_borrow_message(connection);
        if (message == nullptr) {
            usleep(100000);
            continue;
        }
        if (dbus_message_get_type(message) != DBUS_MESSAGE_TYPE_SIGNAL) {
            dbus_connection_return_message(connection, message);
            usleep(1000);  // the caller's thread takes its reply
            continue;
        }
        dbus_connection_steal_borrowed_message(connection, message);
        if (dbus_message_is_signal(message, kInterface, "Stamp")) {
            const char* stamp = "0";
            dbus_message_get_args(message, nullptr, DBUS_TYPE_STRING, &stamp, DBUS_TYPE_INVALID);
            onStamp(nullptr, stamp);
        }
        dbus_message_unref(message);
    }
}

struct Percentiles {
    double median, p99;
};

Percentiles percentiles(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    if (values.empty()) return { 0, 0 };
    return { values[values.size() / 2], values[std::min(values.size() - 1, values.size() * 99 / 100)] };
}

// Emits count signals, each after an idle pause, and waits for them to arrive.
Percentiles measureLatency(DBusConnection* emitter, int count) {
    gLatencies.clear();
    gReceived = 0;
    std::mt19937 random(7);
    std::uniform_int_distribution<int> pause(5, 25);
    for (int i = 0; i < count; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(pause(random)));
        int before = gReceived;
        emitStamp(emitter);
        auto deadline = Clock::now() + std::chrono::seconds(1);
        while (gReceived == before && Clock::now() < deadline) std::this_thread::sleep_for(std::chrono::microseconds(50));
    }
    return percentiles(gLatencies);
}

// Seconds per call for count blocking Echo calls through the library.
__attribute__((noinline)) double libraryCalls(Bluetooth::RemoteObject& caller, int count) {
    auto start = Clock::now();
    for (int i = 0; i < count; ++i) {
        if (caller.newMessage("Echo") != 0 || caller.sendMessage(true, -1) != 0) {
            std::fprintf(stderr, "call %d failed: %s\n", i, caller.getErrorMessage().c_str());
            std::exit(1);
        }
    }
    return std::chrono::duration<double>(Clock::now() - start).count() / count;
}

__attribute__((noinline)) double rawCalls(DBusConnection* connection, int count) {
    auto start = Clock::now();
    for (int i = 0; i < count; ++i) {
        DBusMessage* call = dbus_message_new_method_call(kService, kPath, kInterface, "Echo");
        DBusMessage* reply = dbus_connection_send_with_reply_and_block(connection, call, -1, nullptr);
        dbus_message_unref(call);
        if (reply == nullptr) std::exit(1);
        dbus_message_unref(reply);
    }
    return std::chrono::duration<double>(Clock::now() - start).count() / count;
}


// ---- decoding ----

// Appends one {sv} entry to an open dictionary; an array's value is a
// null-ended list of texts.
void appendEntry(DBusMessageIter& dict, const char* name, int type, const char* signature, const void* value) {
    DBusMessageIter e, v;
    dbus_message_iter_open_container(&dict, DBUS_TYPE_DICT_ENTRY, nullptr, &e);
    dbus_message_iter_append_basic(&e, DBUS_TYPE_STRING, &name);
    dbus_message_iter_open_container(&e, DBUS_TYPE_VARIANT, signature, &v);
    if (type == DBUS_TYPE_ARRAY) {
        DBusMessageIter a;
        dbus_message_iter_open_container(&v, DBUS_TYPE_ARRAY, signature + 1, &a);
        for (const char* const* item = static_cast<const char* const*>(value); *item; ++item)
            dbus_message_iter_append_basic(&a, signature[1], item);
        dbus_message_iter_close_container(&v, &a);
    } else {
        dbus_message_iter_append_basic(&v, type, value);
    }
    dbus_message_iter_close_container(&e, &v);
    dbus_message_iter_close_container(&dict, &e);
}

// An adapter's GetProperties reply as BlueZ sends it: 12 entries.
DBusMessage* propertiesReply() {
    DBusMessage* call = dbus_message_new_method_call("org.bluez", "/org/bluez/1/hci0", "org.bluez.Adapter",
                                                     "GetProperties");
    dbus_message_set_serial(call, 1);
    DBusMessage* reply = dbus_message_new_method_return(call);
    dbus_message_unref(call);
    DBusMessageIter args, dict;
    dbus_message_iter_init_append(reply, &args);
    dbus_message_iter_open_container(&args, DBUS_TYPE_ARRAY, "{sv}", &dict);
    auto entry = [&](const char* name, int type, const char* signature, const void* value) {
        appendEntry(dict, name, type, signature, value);
    };
    const char* address = "00:11:22:33:44:55";
    const char* name = "kitchen-nas";
    dbus_uint32_t cls = 0x4a010c, timeout = 180, pairTimeout = 0;
    dbus_bool_t yes = TRUE, no = FALSE;
    const char* devices[] = { "/org/bluez/1/hci0/dev_00_0D_3C_A1_B2_C3", "/org/bluez/1/hci0/dev_00_12_A1_B0_00_42",
                              nullptr };
    const char* uuids[] = { "00001000-0000-1000-8000-00805f9b34fb", "00001001-0000-1000-8000-00805f9b34fb",
                            "0000110e-0000-1000-8000-00805f9b34fb", "0000110c-0000-1000-8000-00805f9b34fb",
                            nullptr };
    entry("Address", DBUS_TYPE_STRING, "s", &address);
    entry("Name", DBUS_TYPE_STRING, "s", &name);
    entry("Class", DBUS_TYPE_UINT32, "u", &cls);
    entry("Powered", DBUS_TYPE_BOOLEAN, "b", &yes);
    entry("Discoverable", DBUS_TYPE_BOOLEAN, "b", &no);
    entry("Pairable", DBUS_TYPE_BOOLEAN, "b", &yes);
    entry("PairableTimeout", DBUS_TYPE_UINT32, "u", &pairTimeout);
    entry("DiscoverableTimeout", DBUS_TYPE_UINT32, "u", &timeout);
    entry("Discovering", DBUS_TYPE_BOOLEAN, "b", &no);
    entry("Devices", DBUS_TYPE_ARRAY, "ao", devices);
    entry("UUIDs", DBUS_TYPE_ARRAY, "as", uuids);
    entry("Alias", DBUS_TYPE_STRING, "s", &name);
    dbus_message_iter_close_container(&args, &dict);
    return reply;
}

// Reads every value of the reply with libdbus's iterator and nothing else.
__attribute__((noinline)) size_t rawWalk(DBusMessage* reply) {
    size_t seen = 0;
    DBusMessageIter args, dict;
    dbus_message_iter_init(reply, &args);
    for (dbus_message_iter_recurse(&args, &dict); dbus_message_iter_get_arg_type(&dict) == DBUS_TYPE_DICT_ENTRY;
         dbus_message_iter_next(&dict)) {
        DBusMessageIter e, v;
        dbus_message_iter_recurse(&dict, &e);
        const char* name = nullptr;
        dbus_message_iter_get_basic(&e, &name);
        seen += name[0];
        dbus_message_iter_next(&e);
        dbus_message_iter_recurse(&e, &v);
        if (dbus_message_iter_get_arg_type(&v) == DBUS_TYPE_ARRAY) {
            DBusMessageIter a;
            for (dbus_message_iter_recurse(&v, &a); dbus_message_iter_get_arg_type(&a) != DBUS_TYPE_INVALID;
                 dbus_message_iter_next(&a)) {
                const char* text = nullptr;
                dbus_message_iter_get_basic(&a, &text);
                seen += text[0];
            }
        } else {
            DBusBasicValue value;
            dbus_message_iter_get_basic(&v, &value);
            seen += value.u32 & 1;
        }
    }
    return seen;
}

// The library's decoding of the reply into a Dict, as a proxy's caller meets it.
__attribute__((noinline)) size_t libraryDecode(Bluetooth::RemoteObject& reader, DBusMessage* reply) {
    Bluetooth::Dict dict;
    reader.setReplyMessage(dbus_message_ref(reply));
    if (reader.getReplyValue(dict) != 0 || dict.size() != 12) std::exit(1);
    return dict.size();
}

// Decoding time of the library over the raw walk, median of rounds.
double decodeRatio(int rounds, int count) {
    DBusMessage* reply = propertiesReply();
    Bluetooth::RemoteObject reader("org.bluez", "/", "org.bluez.Adapter", DBUS_BUS_SESSION);
    std::vector<double> ratios;
    size_t sink = 0;
    for (int round = 0; round < rounds; ++round) {
        auto start = Clock::now();
        for (int i = 0; i < count; ++i) sink += rawWalk(reply);
        double raw = std::chrono::duration<double>(Clock::now() - start).count();
        start = Clock::now();
        for (int i = 0; i < count; ++i) sink += libraryDecode(reader, reply);
        ratios.push_back(std::chrono::duration<double>(Clock::now() - start).count() / raw);
    }
    dbus_message_unref(reply);
    std::sort(ratios.begin(), ratios.end());
    return sink != 0 ? ratios[ratios.size() / 2] : 0;
}

// ---- one-way calls and a storm of signals ----

double libraryOneWay(Bluetooth::RemoteObject& caller, int count) {
    auto start = Clock::now();
    for (int i = 0; i < count; ++i)
        if (caller.newMessage("Echo") != 0 || caller.sendMessage(false, -1) != 0) std::exit(1);
    return std::chrono::duration<double>(Clock::now() - start).count();
}

double rawOneWay(DBusConnection* connection, int count) {
    auto start = Clock::now();
    for (int i = 0; i < count; ++i) {
        DBusMessage* call = dbus_message_new_method_call(kService, kPath, kInterface, "Echo");
        dbus_message_set_no_reply(call, TRUE);
        if (!dbus_connection_send(connection, call, nullptr)) std::exit(1);
        dbus_connection_flush(connection);
        dbus_message_unref(call);
    }
    return std::chrono::duration<double>(Clock::now() - start).count();
}

// A DeviceFound of BlueZ: an address and five properties.
DBusMessage* foundSignal(const char* member, int i) {
    DBusMessage* signal = dbus_message_new_signal(kPath, kInterface, member);
    char address[18];
    std::snprintf(address, sizeof address, "00:11:22:%02X:%02X:%02X", (i >> 16) & 255, (i >> 8) & 255, i & 255);
    const char* text = address;
    DBusMessageIter args, dict;
    dbus_message_iter_init_append(signal, &args);
    dbus_message_iter_append_basic(&args, DBUS_TYPE_STRING, &text);
    dbus_message_iter_open_container(&args, DBUS_TYPE_ARRAY, "{sv}", &dict);
    auto entry = [&](const char* name, int type, const char* signature, const void* value) {
        appendEntry(dict, name, type, signature, value);
    };
    dbus_uint32_t cls = 0x5a020c;
    dbus_int16_t rssi = -61;
    dbus_bool_t no = FALSE;
    const char* name = "phone";
    entry("Address", DBUS_TYPE_STRING, "s", &text);
    entry("Class", DBUS_TYPE_UINT32, "u", &cls);
    entry("RSSI", DBUS_TYPE_INT16, "n", &rssi);
    entry("Name", DBUS_TYPE_STRING, "s", &name);
    entry("Paired", DBUS_TYPE_BOOLEAN, "b", &no);
    dbus_message_iter_close_container(&args, &dict);
    return signal;
}

std::atomic<int> gFound{ 0 };
std::atomic<bool> gStormOver{ false };

void onFound(Bluetooth::RemoteObject*, const char*, const Bluetooth::Dict* properties) {
    if (properties->size() == 5) ++gFound;
}

// Reads RawFound signals with raw libdbus, every value of each, until count came.
void rawReceive(DBusConnection* connection, int count) {
    while (gFound < count && !gStormOver) {
        dbus_connection_read_write(connection, 100);
        while (DBusMessage* message = dbus_connection_pop_message(connection)) {
            if (dbus_message_is_signal(message, kInterface, "RawFound")) {
                DBusMessageIter args;
                dbus_message_iter_init(message, &args);
                dbus_message_iter_next(&args);
                DBusMessageIter dict;
                size_t seen = 0;
                for (dbus_message_iter_recurse(&args, &dict); dbus_message_iter_get_arg_type(&dict) == DBUS_TYPE_DICT_ENTRY;
                     dbus_message_iter_next(&dict)) {
                    DBusMessageIter e, v;
                    dbus_message_iter_recurse(&dict, &e);
                    dbus_message_iter_next(&e);
                    dbus_message_iter_recurse(&e, &v);
                    DBusBasicValue value;
                    dbus_message_iter_get_basic(&v, &value);
                    ++seen;
                }
                if (seen == 5) ++gFound;
            }
            dbus_message_unref(message);
        }
    }
}

// Seconds from the first signal sent to the last one handled, or -1 if any
// was lost (none came for a second).
double storm(DBusConnection* emitter, const char* member, int count, const std::function<void()>& startReceiver) {
    std::vector<DBusMessage*> signals;
    for (int i = 0; i < count; ++i) signals.push_back(foundSignal(member, i));
    gFound = 0;
    startReceiver();
    auto start = Clock::now();
    for (int i = 0; i < count; ++i) {
        dbus_connection_send(emitter, signals[i], nullptr);
        if (i % 256 == 255) dbus_connection_flush(emitter);
    }
    dbus_connection_flush(emitter);
    int last = -1;
    auto lastChange = Clock::now();
    while (gFound < count) {
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
        if (gFound != last) {
            last = gFound;
            lastChange = Clock::now();
        } else if (Clock::now() - lastChange > std::chrono::seconds(1)) {
            break;
        }
    }
    double seconds = std::chrono::duration<double>(Clock::now() - start).count();
    for (DBusMessage* signal : signals) dbus_message_unref(signal);
    return gFound == count ? seconds : -1;
}

long contextSwitches() {
    struct rusage usage;
    getrusage(RUSAGE_SELF, &usage);
    return usage.ru_nvcsw + usage.ru_nivcsw;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc > 1 && std::string(argv[1]) == "decode") {
        // Only the decoding, with no bus, for an instruction count under
        // callgrind: compare the inclusive costs of rawWalk and libraryDecode.
        setenv("DBUS_SESSION_BUS_ADDRESS", "unix:path=/nonexistent/btbus-bench", 1);
        DBusMessage* reply = propertiesReply();
        Bluetooth::RemoteObject reader("org.bluez", "/", "org.bluez.Adapter", DBUS_BUS_SESSION);
        size_t sink = 0;
        for (int i = 0; i < 1000; ++i) sink += rawWalk(reply) + libraryDecode(reader, reply);
        dbus_message_unref(reply);
        return sink != 0 ? 0 : 1;
    }
    bool countCalls = argc > 1 && std::string(argv[1]) == "calls";
    int signals = argc > 1 && !countCalls ? std::atoi(argv[1]) : 200;
    int calls = argc > 2 ? std::atoi(argv[2]) : 5000;
    std::string address = startBus();
    if (address.empty()) {
        std::fprintf(stderr, "cannot start dbus-daemon\n");
        return 1;
    }
    setenv("DBUS_SESSION_BUS_ADDRESS", address.c_str(), 1);

    DBusConnection* peer = privateConnection();
    DBusConnection* emitter = privateConnection();
    DBusConnection* rawCaller = privateConnection();
    DBusConnection* blind = privateConnection();
    // The caller's shared connection; the blind loop has one of its own.
    Bluetooth::RemoteObject caller(kService, kPath, kInterface, DBUS_BUS_SESSION);
    if (!peer || !emitter || !rawCaller || !blind || !caller.getConnection()) {
        std::fprintf(stderr, "cannot connect to the private bus at %s\n", address.c_str());
        stopBus();
        return 1;
    }
    dbus_bus_request_name(peer, kService, 0, nullptr);
    std::thread peerThread(servePeer, peer);
    if (countCalls) {
        // Only blocking calls, no loop, for an instruction count under
        // callgrind: compare the inclusive costs of rawCalls and libraryCalls.
        rawCalls(rawCaller, 2000);
        libraryCalls(caller, 2000);
        gPeerStop = true;
        peerThread.join();
        stopBus();
        return 0;
    }
    std::string rule = std::string("type='signal',interface='") + kInterface + "'";
    dbus_bus_add_match(blind, rule.c_str(), nullptr);

    std::printf("btbus receiving loop, %d idle signals, %d blocking calls per round\n\n", signals, calls);
    // Each case is measured in rounds, each beside a raw round, and reported as
    // the median of its ratios, so that load from elsewhere cancels out.
    const int kRounds = 5;
    auto ratio = [&](const std::function<double()>& measure, double& perCall) {
        std::vector<double> ratios, times;
        for (int round = 0; round < kRounds; ++round) {
            double raw = rawCalls(rawCaller, calls);
            double t = measure();
            ratios.push_back(t / raw);
            times.push_back(t);
        }
        std::sort(times.begin(), times.end());
        perCall = times[kRounds / 2];
        std::sort(ratios.begin(), ratios.end());
        return ratios[kRounds / 2];
    };
    double noLoop = 0, withBlind = 0, withLoop = 0;
    double noLoopRatio = ratio([&] { return libraryCalls(caller, calls); }, noLoop);

    std::thread blindThread(blindLoop, blind);
    Percentiles blindLatency = measureLatency(emitter, signals);
    gBlindStop = true;
    blindThread.join();
    gBlindStop = false;
    // The sleeping loop on the caller's own connection, as a receiving thread is.
    std::thread blindOnCaller(blindLoop, caller.getConnection());
    double blindRatio = ratio([&] { return libraryCalls(caller, calls); }, withBlind);
    gBlindStop = true;
    blindOnCaller.join();

    long idleBefore = contextSwitches();
    std::this_thread::sleep_for(std::chrono::seconds(2));
    long quietSwitches = contextSwitches() - idleBefore;
    if (caller.setSignalHandlerString("Stamp", &onStamp) != 0 || caller.startLoop() != 0) return 1;
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    idleBefore = contextSwitches();
    std::this_thread::sleep_for(std::chrono::seconds(2));
    long idleSwitches = contextSwitches() - idleBefore;
    Percentiles loopLatency = measureLatency(emitter, signals);
    double loopRatio = ratio([&] { return libraryCalls(caller, calls); }, withLoop);

    // Each receiver gets its own signals only: the raw one RawFound, the
    // library's handler Found.
    const int kStorm = 100000;
    std::vector<double> oneWay, found;
    dbus_bus_remove_match(blind, rule.c_str(), nullptr);
    dbus_bus_add_match(blind, (rule + ",member='RawFound'").c_str(), nullptr);
    caller.setSignalHandlerStringDict("Found", &onFound);
    for (int round = 0; round < kRounds; ++round) {
        oneWay.push_back(libraryOneWay(caller, calls) / rawOneWay(rawCaller, calls));
        std::thread rawThread;
        double raw = storm(emitter, "RawFound", kStorm, [&] { rawThread = std::thread(rawReceive, blind, kStorm); });
        gStormOver = true;
        rawThread.join();
        gStormOver = false;
        double library = storm(emitter, "Found", kStorm, [] {});
        found.push_back(raw > 0 && library > 0 ? library / raw : -1);
    }
    std::sort(oneWay.begin(), oneWay.end());
    std::sort(found.begin(), found.end());
    caller.stopLoop();
    caller.waitLoop();

    std::printf("latency from idle to handler    median      p99\n");
    std::printf("  loop that sleeps 100 ms     %8.3f ms %8.3f ms\n", blindLatency.median / 1000, blindLatency.p99 / 1000);
    std::printf("  btbus loop                  %8.3f ms %8.3f ms\n\n", loopLatency.median / 1000, loopLatency.p99 / 1000);
    std::printf("blocking call (median of %d)    per call   ratio to raw libdbus\n", kRounds);
    std::printf("  btbus, no loop              %8.1f us   %.2f\n", noLoop * 1e6, noLoopRatio);
    std::printf("  btbus, sleeping loop        %8.1f us   %.2f\n", withBlind * 1e6, blindRatio);
    std::printf("  btbus, btbus loop           %8.1f us   %.2f\n\n", withLoop * 1e6, loopRatio);
    std::printf("decoding a 12-entry GetProperties reply into a Dict: %.2f x a raw iterator walk\n",
                decodeRatio(kRounds, 20000));
    std::printf("one-way calls: %.2f x raw libdbus\n", oneWay[kRounds / 2]);
    if (found.front() < 0)
        std::printf("%d DeviceFound signals: LOST some\n", kStorm);
    else
        std::printf("%d DeviceFound signals, none lost: %.2f x raw libdbus\n", kStorm, found[kRounds / 2]);
    std::printf("context switches in 2 idle seconds: %ld with an idle loop, %ld without\n", idleSwitches,
                quietSwitches);

    gPeerStop = true;
    peerThread.join();
    for (DBusConnection* c : { peer, emitter, rawCaller, blind }) {
        dbus_connection_close(c);
        dbus_connection_unref(c);
    }
    stopBus();
    return 0;
}
