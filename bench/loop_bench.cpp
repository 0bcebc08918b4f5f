// Measures the receiving thread on a private dbus-daemon, in one run:
//  1. latency from an idle loop to the handler, for the library's loop and for
//     a loop that sleeps 100 ms whenever nothing is queued;
//  2. the cost of blocking calls while each of those loops runs, as a ratio to
//     the same calls made with raw libdbus and no loop at all.
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
            if (dbus_message_is_method_call(message, kInterface, "Echo")) {
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
double libraryCalls(Bluetooth::RemoteObject& caller, int count) {
    auto start = Clock::now();
    for (int i = 0; i < count; ++i) {
        if (caller.newMessage("Echo") != 0 || caller.sendMessage(true, -1) != 0) {
            std::fprintf(stderr, "call %d failed: %s\n", i, caller.getErrorMessage().c_str());
            std::exit(1);
        }
    }
    return std::chrono::duration<double>(Clock::now() - start).count() / count;
}

double rawCalls(DBusConnection* connection, int count) {
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

}  // namespace

int main(int argc, char** argv) {
    int signals = argc > 1 ? std::atoi(argv[1]) : 200;
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

    if (caller.setSignalHandlerString("Stamp", &onStamp) != 0 || caller.startLoop() != 0) return 1;
    Percentiles loopLatency = measureLatency(emitter, signals);
    double loopRatio = ratio([&] { return libraryCalls(caller, calls); }, withLoop);
    caller.stopLoop();
    caller.waitLoop();

    std::printf("latency from idle to handler    median      p99\n");
    std::printf("  loop that sleeps 100 ms     %8.3f ms %8.3f ms\n", blindLatency.median / 1000, blindLatency.p99 / 1000);
    std::printf("  btbus loop                  %8.3f ms %8.3f ms\n\n", loopLatency.median / 1000, loopLatency.p99 / 1000);
    std::printf("blocking call (median of %d)    per call   ratio to raw libdbus\n", kRounds);
    std::printf("  btbus, no loop              %8.1f us   %.2f\n", noLoop * 1e6, noLoopRatio);
    std::printf("  btbus, sleeping loop        %8.1f us   %.2f\n", withBlind * 1e6, blindRatio);
    std::printf("  btbus, btbus loop           %8.1f us   %.2f\n", withLoop * 1e6, loopRatio);

    gPeerStop = true;
    peerThread.join();
    for (DBusConnection* c : { peer, emitter, rawCaller, blind }) {
        dbus_connection_close(c);
        dbus_connection_unref(c);
    }
    stopBus();
    return 0;
}
