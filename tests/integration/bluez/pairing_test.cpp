// Adapter::createPairedDevice with the library's own Agent answering
// bluez4-sim, and the agent answering peers outside any pairing call, whichever
// thread dispatches the connection.
#include <algorithm>
#include <atomic>
#include <chrono>
#include <iterator>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <dbus/dbus-glib-lowlevel.h>
#include <gtest/gtest.h>

#include <bluetooth/btbus.h>

#include "core/dbus_holders.h"
#include "support/log_capture.h"
#include "support/process.h"
#include "support/sim.h"

namespace {

using namespace Bluetooth;
using namespace btbus_test;
using sim::kKeyboard, sim::kPhone;

// What reached the agent, and on which thread: a dispatcher in front of the
// agent's own.
std::mutex gLock;
std::vector<std::string> gMembers;
std::vector<std::thread::id> gThreads;
DBusHandlerResult recordingDispatcher(DBusConnection* connection, DBusMessage* message, void* agent) {
    {
        std::lock_guard<std::mutex> lock(gLock);
        gMembers.push_back(dbus_message_get_member(message) ? dbus_message_get_member(message) : "");
        gThreads.push_back(std::this_thread::get_id());
    }
    return Agent::handlerDispatcher(connection, message, agent);
}
size_t reached(const std::string& member) {
    std::lock_guard<std::mutex> lock(gLock);
    return std::count(gMembers.begin(), gMembers.end(), member);
}

class APairing : public SimTest {
protected:
    void SetUp() override {
        SimTest::SetUp();
        {
            std::lock_guard<std::mutex> lock(gLock);
            gMembers.clear();
            gThreads.clear();
        }
        adapter.reset(Adapter::getAdapter(sim::defaultAdapterPath().c_str()));
        ASSERT_NE(adapter, nullptr);
        ASSERT_EQ(agent.setDispatcher(&recordingDispatcher), 0);
        ASSERT_EQ(agent.registerPath(), 0);
    }
    void TearDown() override { agent.unregisterPath(); }

    // The simulator's record of its calls to this agent: "Member(arguments) -> answer".
    std::vector<std::string> agentCalls() {
        const std::string prefix = std::string("agent ") + adapter->getConnectionName() + " " + agent.getPath() +
                                   " org.bluez.Agent.";
        std::vector<std::string> calls = sim::logLinesWith(prefix);
        for (std::string& line : calls) line.erase(0, prefix.size());
        return calls;
    }

    std::unique_ptr<Adapter> adapter;
    Agent agent;
};

TEST_F(APairing, OffersTheAgentsCapabilityAndLogsBluezsReasonWhenItFails) {
    sim::receivingLoop();  // Release may follow the reply
    ASSERT_EQ(agent.setCapability(Agent::PSZ_KEYBOARD_ONLY), 0);
    const std::string keyboard = sim::devicePath(kKeyboard), phone = sim::devicePath(kPhone);
    const struct {
        const char* passkey;
        const char* address;
        std::string request;  // the agent's, with its answer, before Release
        std::string outcome;  // the device's path, or BlueZ's reason for failing
    } rows[] = {
        { "0000", kKeyboard, "RequestPinCode(" + keyboard + ") -> 0000", keyboard },  // legacy: a PIN all the same
        { "482913", kPhone, "RequestPasskey(" + phone + ") -> 482913", phone },
        { "four", kPhone, "RequestPasskey(" + phone + ") -> 0", "Authentication Failed" },  // not a number
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.request);
        ASSERT_TRUE(sim::start());  // nothing paired yet
        ASSERT_EQ(agent.setPasskeyValue(row.passkey), 0);
        LogCapture log;
        std::unique_ptr<Device> device(adapter->createPairedDevice(row.address, agent));
        EXPECT_EQ(sim::logLinesWith("CreatePairedDevice"),
                  std::vector<std::string>{ std::string(adapter->getPath()) + " org.bluez.Adapter.CreatePairedDevice(" +
                                            row.address + ", " + agent.getPath() + ", KeyboardOnly)" });
        EXPECT_EQ(agentCalls(), (std::vector<std::string>{ row.request, "Release() -> sent" }));
        EXPECT_EQ(device ? device->getPath() : adapter->getErrorMessage(), row.outcome);
        EXPECT_EQ(adapter->getErrorNumber(), device ? 0 : 11);
        EXPECT_EQ(log.lines(), device ? std::vector<std::string>{}
                                      : std::vector<std::string>{ "adapter.cpp:312 " + row.outcome });
    }
    EXPECT_TRUE(waitUntil([&] { return reached("Release") == std::size(rows); }));
}

TEST_F(APairing, ForwardsACancellationToTheAgentAndFails) {
    sim::receivingLoop();  // to dispatch what arrives after the call returned
    ASSERT_EQ(agent.setPasskeyValue("0000"), 0);
    ASSERT_EQ(agent.setPasskeyDelay(1), 0);
    std::thread canceller([this] {
        // While the agent sits on the PIN request.
        EXPECT_TRUE(waitUntil([] { return reached("RequestPinCode") == 1; }));
        std::unique_ptr<Adapter> other(Adapter::getAdapter(adapter->getPath()));
        EXPECT_EQ(other->cancelDeviceCreation(kKeyboard), 0);
    });
    LogCapture log;
    EXPECT_EQ(adapter->createPairedDevice(kKeyboard, agent), nullptr);
    canceller.join();
    EXPECT_EQ(log.lines(), std::vector<std::string>{ "adapter.cpp:312 Authentication Canceled" });
    EXPECT_TRUE(waitUntil([] { return reached("Cancel") == 1 && reached("Release") == 1; }));
    EXPECT_EQ(agentCalls(), (std::vector<std::string>{ "RequestPinCode(" + sim::devicePath(kKeyboard) + ") -> 0000",
                                                       "Cancel() -> sent", "Release() -> sent" }));
}

// Calls the agent from a connection of the test's own, the way a peer would,
// with arguments of the given types (o, s, u): the reply's first argument as
// text ("" for none), or the error's name.
std::string callAsAPeer(const std::string& destination, const char* path, const char* member, int timeoutMs,
                        const char* types = "", const char* interface = "org.bluez.Agent") {
    DBusConnection* connection = dbus_bus_get_private(DBUS_BUS_SYSTEM, nullptr);
    if (connection == nullptr) return "no connection";
    dbus_connection_set_exit_on_disconnect(connection, FALSE);
    Bluetooth::internal::MessagePtr message(dbus_message_new_method_call(destination.c_str(), path, interface, member));
    const char* text = "/org/bluez/1/hci0/dev_00_11_22_33_44_55";
    dbus_uint32_t number = 123456;
    for (const char* type = types; *type != '\0'; ++type)
        dbus_message_append_args(message.get(), int(*type), *type == 'u' ? static_cast<void*>(&number) : &text,
                                 DBUS_TYPE_INVALID);
    Bluetooth::internal::ScopedError error;
    Bluetooth::internal::MessagePtr reply(
        dbus_connection_send_with_reply_and_block(connection, message.get(), timeoutMs, error.get()));
    dbus_connection_close(connection);
    dbus_connection_unref(connection);
    DBusMessageIter value;
    if (!reply || !dbus_message_iter_init(reply.get(), &value)) return error.name();
    const bool isNumber = dbus_message_iter_get_arg_type(&value) == DBUS_TYPE_UINT32;
    dbus_message_iter_get_basic(&value, isNumber ? static_cast<void*>(&number) : &text);
    return isNumber ? std::to_string(number) : text;
}

// Every kind of request a peer can make of the agent, answered by a thread
// other than the caller's, whichever dispatches the connection: the answer, at
// once, the line logged, then the delay before a PIN.
void expectAnswersToPeers(const std::string& me, Agent& agent) {
    ASSERT_EQ(agent.setPasskeyValue("482913"), 0);
    ASSERT_EQ(agent.setPasskeyDelay(0), 0);
    const char* const unhandled = "agent.cpp:410 Registered agent does not provide a handler for the incoming message.";
    const char* const unknown = "org.freedesktop.DBus.Error.UnknownMethod";
    const char* const rejected = "org.bluez.Error.Rejected";
    const char* const noReply = "org.freedesktop.DBus.Error.NoReply";
    const char* const confirmation = "agent.cpp:252 Failed to get argument from request confirmation message.";
    const struct {
        const char* member;
        const char* types;
        const char* answer;
        const char* log;
        bool reject = false;
        const char* interface = "org.bluez.Agent";
    } rows[] = {
        { "RequestPinCode", "o", "482913", "" },
        { "RequestPasskey", "o", "482913", "" },
        { "RequestConfirmation", "ou", "", "" },
        { "Authorize", "os", "", "" },
        { "Cancel", "", "", "" },
        { "Release", "", "", "" },
        // deliberate asymmetry: rejecting refuses all but a PIN.
        { "RequestPinCode", "o", "482913", "", true },
        { "RequestPasskey", "o", rejected, "", true },
        { "RequestConfirmation", "ou", rejected, "", true },
        { "Authorize", "os", rejected, "", true },
        // Not the agent's answers: libdbus answers at once what no handler took.
        { "DisplayPasskey", "ou", unknown, unhandled },
        { "ConfirmModeChange", "", unknown, unhandled },
        { "DisplayPinCode", "", unknown, unhandled },
        { "RequestPinCode", "o", unknown, unhandled, false, "org.bluez.Adapter" },
        { "Release", "", unknown, unhandled, false, "org.example.Other" },
        { "RequestPasskey", "", unknown, "agent.cpp:200 Failed to get argument from request passkey message." },
        { "RequestConfirmation", "", unknown, confirmation },
        { "RequestConfirmation", "os", unknown, confirmation },
        { "Authorize", "", unknown, "agent.cpp:293 Failed to get argument from authorize message." },
        // deliberate asymmetry: bad arguments of a PIN request count as handled, with no answer at all.
        { "RequestPinCode", "", noReply, "agent.cpp:167 Failed to get argument from request pin code message." },
    };
    const size_t before = [] {
        std::lock_guard<std::mutex> lock(gLock);
        return gThreads.size();
    }();
    for (const auto& row : rows) {
        SCOPED_TRACE(std::string(row.interface) + "." + row.member + "(" + row.types + ")" +
                     (row.reject ? " rejecting" : ""));
        agent.setReject(row.reject);
        LogCapture log;
        auto start = std::chrono::steady_clock::now();
        EXPECT_EQ(callAsAPeer(me, agent.getPath(), row.member, 1000, row.types, row.interface), row.answer);
        if (std::string(row.answer) != noReply)
            EXPECT_LT(std::chrono::steady_clock::now() - start, scaled(500ms));
        EXPECT_EQ(log.lines(), *row.log ? std::vector<std::string>{ row.log } : std::vector<std::string>{});
    }
    agent.setReject(false);
    ASSERT_EQ(agent.setPasskeyDelay(1), 0);
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(callAsAPeer(me, agent.getPath(), "RequestPinCode", 3000, "o"), "482913");
    EXPECT_GE(std::chrono::steady_clock::now() - start, 1s);
    std::lock_guard<std::mutex> lock(gLock);
    EXPECT_EQ(gThreads.size(), before + std::size(rows) + 1) << "not every request reached the agent's dispatcher";
    EXPECT_EQ(std::count(gThreads.begin() + before, gThreads.end(), std::this_thread::get_id()), 0);
}

TEST_F(APairing, AgentAnswersPeersOnTheReceivingThread) {
    sim::receivingLoop();
    expectAnswersToPeers(adapter->getConnectionName(), agent);
}

TEST_F(APairing, AgentPathIsRegisteredOncePerProcessAndFreedWhenItsAgentIsDestroyed) {
    LogCapture log;
    Agent second;
    EXPECT_EQ(second.registerPath(), -1);
    EXPECT_STREQ(second.getPath(), agent.getPath());
    EXPECT_EQ(second.unregisterPath(), -1) << "unregistered the other agent's path";
    EXPECT_EQ(agent.unregisterPath(), 0);
    EXPECT_EQ(agent.unregisterPath(), -1);
    EXPECT_EQ(second.registerPath(), 0);
    EXPECT_EQ(second.unregisterPath(), 0);
    EXPECT_EQ(log.lines(), (std::vector<std::string>{ "agent.cpp:54 Failed to register agent path to dbus.",
                                                      "agent.cpp:65 Failed to unregister agent path from dbus.",
                                                      "agent.cpp:65 Failed to unregister agent path from dbus." }));
    sim::receivingLoop();
    auto forgotten = std::make_unique<Agent>();
    ASSERT_EQ(forgotten->registerPath(), 0);
    const std::string path = forgotten->getPath();
    forgotten.reset();  // without unregisterPath
    EXPECT_EQ(callAsAPeer(adapter->getConnectionName(), path.c_str(), "Release", 3000),
              "org.freedesktop.DBus.Error.UnknownMethod");
    EXPECT_EQ(agent.registerPath(), 0);
}

// Without a receiving thread of the library, whichever thread dispatches the
// connection answers: the pairing call's own, a blocking call's, or a loop of
// the program's own, plain libdbus or GLib's main loop.
TEST_F(APairing, WithoutAReceivingThreadIsAnsweredByTheThreadThatDispatches) {
    BTBUS_IN_OWN_PROCESS();  // another receiving thread may already run here
    ASSERT_FALSE(sim::receivingLoopRunning());
    ASSERT_EQ(agent.setPasskeyValue("0000"), 0);
    std::unique_ptr<Device> keyboard(adapter->createPairedDevice(kKeyboard, agent));
    EXPECT_NE(keyboard, nullptr) << adapter->getErrorMessage();
    ASSERT_TRUE(sim::start());  // the keyboard unpaired again
    adapter->newMessage("CreatePairedDevice");
    adapter->append(kKeyboard);
    adapter->append(ObjectPath(agent.getPath()));
    adapter->append(agent.getCapability());
    EXPECT_EQ(adapter->sendMessage(true, -1), 0) << adapter->getErrorMessage();
    ObjectPath device;
    EXPECT_EQ(adapter->getReplyValue(device), 0);
    EXPECT_EQ(device.str(), sim::devicePath(kKeyboard));
    {
        // The last Release may follow the reply: the next thread that dispatches answers it.
        std::lock_guard<std::mutex> lock(gLock);
        ASSERT_GE(gMembers.size(), 3u);
        EXPECT_EQ(std::vector<std::string>(gMembers.begin(), gMembers.begin() + 3),
                  (std::vector<std::string>{ "RequestPinCode", "Release", "RequestPinCode" }));
        EXPECT_EQ(std::count(gThreads.begin(), gThreads.begin() + 3, std::this_thread::get_id()), 3);
    }
    DBusConnection* system = Connection::get(DBUS_BUS_SYSTEM);
    std::atomic<bool> dispatching{ true };
    std::thread loop([&] {
        while (dispatching) dbus_connection_read_write_dispatch(system, 20);
    });
    EXPECT_TRUE(waitUntil([] { return reached("Release") == 2; }));
    expectAnswersToPeers(adapter->getConnectionName(), agent);
    {
        // A passkey that cannot be sent: no answer, logged once, and the request is not dispatched
        // again and again ahead of the next one.
        ASSERT_EQ(agent.setPasskeyValue("\xff\xfe"), 0);
        LogCapture log;
        EXPECT_EQ(callAsAPeer(adapter->getConnectionName(), agent.getPath(), "RequestPinCode", 1000, "o"),
                  "org.freedesktop.DBus.Error.NoReply");
        EXPECT_EQ(callAsAPeer(adapter->getConnectionName(), agent.getPath(), "Release", 10000), "");  // the next one
        EXPECT_EQ(log.lines(), std::vector<std::string>{
            "agent.cpp:173 Failed to create reply message when handling request pin code message." });
    }
    dispatching = false;
    loop.join();
    dbus_connection_setup_with_g_main(system, nullptr);
    GMainLoop* glibLoop = g_main_loop_new(nullptr, FALSE);
    std::thread glib([glibLoop] { g_main_loop_run(glibLoop); });
    expectAnswersToPeers(adapter->getConnectionName(), agent);
    g_main_loop_quit(glibLoop);
    glib.join();
    g_main_loop_unref(glibLoop);
    Connection::unref(system);
}

}  // namespace
