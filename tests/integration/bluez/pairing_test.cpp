// Adapter::createPairedDevice with the library's own Agent answering
// bluez4-sim, and the agent answering outside any pairing call.
#include <algorithm>
#include <atomic>
#include <chrono>
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
using btbus_test::LogCapture;
using btbus_test::SimTest;
using btbus_test::waitUntil;
using namespace std::chrono_literals;
namespace sim = btbus_test::sim;
using btbus_test::sim::kKeyboard;
using btbus_test::sim::kPhone;
using btbus_test::sim::kFarLaptop;

const char kA2dpSink[] = "0000110b-0000-1000-8000-00805f9b34fb";

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
std::vector<std::string> members() {
    std::lock_guard<std::mutex> lock(gLock);
    return gMembers;
}
bool reached(const std::string& member) {
    std::vector<std::string> seen = members();
    return std::find(seen.begin(), seen.end(), member) != seen.end();
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
        prefix = std::string("agent ") + adapter->getConnectionName() + " " + agent.getPath() +
                 " org.bluez.Agent.";
    }
    void TearDown() override { agent.unregisterPath(); }

    // The simulator's record of its calls to this agent.
    std::vector<std::string> agentCalls() { return sim::logLinesWith(prefix); }
    std::string call(const std::string& rest) { return prefix + rest; }
    // For requests outside a pairing call, which the receiving thread serves.
    void registerWithAdapter() {
        sim::receivingLoop();
        ASSERT_EQ(adapter->registerAgent(agent), 0);
        ASSERT_TRUE(sim::waitForLogLine("RegisterAgent"));
    }

    std::unique_ptr<Adapter> adapter;
    Agent agent;
    std::string prefix;
};

TEST_F(APairing, AnswersAPinRequestWithThePasskeyTextAfterTheDelayAndIsReleasedAfterwards) {
    sim::receivingLoop();  // Release may follow the reply
    ASSERT_EQ(agent.setPasskeyValue("0000"), 0);
    ASSERT_EQ(agent.setPasskeyDelay(1), 0);
    LogCapture log;
    auto start = std::chrono::steady_clock::now();
    std::unique_ptr<Device> keyboard(adapter->createPairedDevice(kKeyboard, agent));
    auto took = std::chrono::steady_clock::now() - start;
    ASSERT_NE(keyboard, nullptr) << adapter->getErrorMessage();
    EXPECT_GE(took, 1s);
    EXPECT_LT(took, btbus_test::scaled(5s));
    EXPECT_EQ(keyboard->getPath(), sim::devicePath(kKeyboard));
    EXPECT_EQ(agentCalls(), (std::vector<std::string>{ call("RequestPinCode(" + sim::devicePath(kKeyboard) + ") -> 0000"),
                                                       call("Release() -> sent") }));
    EXPECT_TRUE(waitUntil([] { return reached("Release"); }));
    EXPECT_TRUE(log.lines().empty());
    std::unique_ptr<Dict> properties(keyboard->getProperties());
    ASSERT_TRUE(properties != nullptr);
    EXPECT_EQ(Bluetooth::find(properties.get(), "Paired"), "1");
}

TEST_F(APairing, AnswersEachKindOfRequestAsItsSettingsSay) {
    const std::string keyboard = sim::devicePath(kKeyboard), phone = sim::devicePath(kPhone);
    const char* const yesNo = "DisplayYesNo";  // the default capability
    const char* const keys = Agent::PSZ_KEYBOARD_ONLY;
    struct Row {
        const char* name;
        const char* capability;
        const char* passkey;
        bool reject;
        const char* address;
        std::string request;  // the agent's first call and answer, as the simulator logs it
        bool paired;          // else "Authentication Failed"
    };
    // deliberate asymmetry: rejecting refuses passkeys and confirmations, not PINs.
    const std::vector<Row> rows = {
        { "PIN while rejecting", yesNo, "0000", true, kKeyboard, "RequestPinCode(" + keyboard + ") -> 0000", true },
        { "wrong PIN", yesNo, "7391", false, kKeyboard, "RequestPinCode(" + keyboard + ") -> 7391", false },
        { "passkey", keys, "482913", false, kPhone, "RequestPasskey(" + phone + ") -> 482913", true },
        { "passkey text that is not a number", keys, "four", false, kPhone, "RequestPasskey(" + phone + ") -> 0", false },
        { "passkey while rejecting", keys, "7391", true, kPhone,
          "RequestPasskey(" + phone + ") -> error org.bluez.Error.Rejected", false },
        { "confirmation, not compared", yesNo, "1", false, kPhone, "RequestConfirmation(" + phone + ", 482913) -> ", true },
        { "confirmation while rejecting", yesNo, "7391", true, kPhone,
          "RequestConfirmation(" + phone + ", 482913) -> error org.bluez.Error.Rejected", false },
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        ASSERT_TRUE(sim::start());  // nothing paired yet
        ASSERT_EQ(agent.setCapability(row.capability), 0);
        ASSERT_EQ(agent.setPasskeyValue(row.passkey), 0);
        agent.setReject(row.reject);
        LogCapture log;
        std::unique_ptr<Device> device(adapter->createPairedDevice(row.address, agent));
        EXPECT_EQ(device != nullptr, row.paired) << adapter->getErrorMessage();
        EXPECT_EQ(sim::logLinesWith("CreatePairedDevice"),
                  std::vector<std::string>{ std::string(adapter->getPath()) + " org.bluez.Adapter.CreatePairedDevice(" +
                                            row.address + ", " + agent.getPath() + ", " + row.capability + ")" });
        EXPECT_EQ(agentCalls().at(0), call(row.request));
        if (row.paired) {
            EXPECT_TRUE(log.lines().empty());
        } else {
            EXPECT_EQ(adapter->getErrorNumber(), 11);
            EXPECT_EQ(log.lines(), std::vector<std::string>{ "adapter.cpp:312 Authentication Failed" });
        }
    }
}

TEST_F(APairing, ForwardsACancellationToTheAgentAndFails) {
    sim::receivingLoop();  // to dispatch what arrives after the call returned
    ASSERT_EQ(agent.setPasskeyValue("0000"), 0);
    ASSERT_EQ(agent.setPasskeyDelay(1), 0);
    std::thread canceller([this] {
        // While the agent sits on the PIN request.
        EXPECT_TRUE(waitUntil([] { return reached("RequestPinCode"); }));
        std::unique_ptr<Adapter> other(Adapter::getAdapter(adapter->getPath()));
        EXPECT_EQ(other->cancelDeviceCreation(kKeyboard), 0);
    });
    LogCapture log;
    EXPECT_EQ(adapter->createPairedDevice(kKeyboard, agent), nullptr);
    canceller.join();
    EXPECT_EQ(log.lines(), std::vector<std::string>{ "adapter.cpp:312 Authentication Canceled" });
    EXPECT_TRUE(waitUntil([] { return reached("Cancel") && reached("Release"); }));
    std::vector<std::string> calls = agentCalls();
    EXPECT_NE(std::find(calls.begin(), calls.end(), call("Cancel() -> sent")), calls.end());
}

TEST_F(APairing, ReleasesTheAgentWhenTheDeviceCannotBeReached) {
    sim::receivingLoop();  // Release may follow the reply
    LogCapture log;
    EXPECT_EQ(adapter->createPairedDevice(kFarLaptop, agent), nullptr);
    EXPECT_EQ(log.lines(), std::vector<std::string>{ "adapter.cpp:312 Page Timeout" });
    EXPECT_EQ(agentCalls(), std::vector<std::string>{ call("Release() -> sent") });
    EXPECT_TRUE(waitUntil([] { return reached("Release"); }));
}

TEST_F(APairing, AgentAuthorisesIncomingConnectionsOnTheReceivingThread) {
    ASSERT_NO_FATAL_FAILURE(registerWithAdapter());
    // Nothing dispatches the connection on this thread: only the receiving thread can answer.
    EXPECT_EQ(sim::incomingConnection("hci0", kPhone, kA2dpSink), "accepted");
    agent.setReject(true);
    EXPECT_EQ(sim::incomingConnection("hci0", kPhone, kA2dpSink), "org.bluez.Error.Rejected");
    const std::string device = sim::devicePath(kPhone);
    EXPECT_EQ(agentCalls(), (std::vector<std::string>{
                                call("Authorize(" + device + ", " + kA2dpSink + ") -> "),
                                call("Authorize(" + device + ", " + kA2dpSink + ") -> error org.bluez.Error.Rejected") }));
    std::lock_guard<std::mutex> lock(gLock);
    ASSERT_EQ(gThreads.size(), 2u);
    EXPECT_NE(gThreads[0], std::this_thread::get_id());
    EXPECT_NE(gThreads[1], std::this_thread::get_id());
}

// Calls the agent from a connection of the test's own, the way a peer would,
// with arguments of the given types: the reply's first argument as text ("" for
// none), or the error's name.
std::string callAsAPeer(const std::string& destination, const char* path, const char* member, int timeoutMs,
                        const char* types = "", const char* interface = "org.bluez.Agent") {
    DBusConnection* connection = dbus_bus_get_private(DBUS_BUS_SYSTEM, nullptr);
    if (connection == nullptr) return "no connection";
    dbus_connection_set_exit_on_disconnect(connection, FALSE);
    Bluetooth::internal::MessagePtr message(
        dbus_message_new_method_call(destination.c_str(), path, interface, member));
    const char* device = "/org/bluez/1/hci0/dev_00_11_22_33_44_55";
    const char* uuid = kA2dpSink;
    dbus_uint32_t passkey = 123456;
    for (const char* type = types; *type != '\0'; ++type) {
        if (*type == 'o') dbus_message_append_args(message.get(), DBUS_TYPE_OBJECT_PATH, &device, DBUS_TYPE_INVALID);
        if (*type == 'u') dbus_message_append_args(message.get(), DBUS_TYPE_UINT32, &passkey, DBUS_TYPE_INVALID);
        if (*type == 's') dbus_message_append_args(message.get(), DBUS_TYPE_STRING, &uuid, DBUS_TYPE_INVALID);
    }
    Bluetooth::internal::ScopedError error;
    Bluetooth::internal::MessagePtr reply(
        dbus_connection_send_with_reply_and_block(connection, message.get(), timeoutMs, error.get()));
    dbus_connection_close(connection);
    dbus_connection_unref(connection);
    DBusMessageIter value;
    if (!reply || !dbus_message_iter_init(reply.get(), &value)) return error.name();
    if (dbus_message_iter_get_arg_type(&value) == DBUS_TYPE_UINT32) {
        dbus_message_iter_get_basic(&value, &passkey);
        return std::to_string(passkey);
    }
    const char* text = "?";
    if (dbus_message_iter_get_arg_type(&value) == DBUS_TYPE_STRING) dbus_message_iter_get_basic(&value, &text);
    return text;
}

// Every kind of request a peer can make of the agent, whichever thread
// dispatches the connection: the answer, and the line logged.
void expectAnswersToPeers(const std::string& me, const Agent& agent) {
    const char* const unhandled = "agent.cpp:410 Registered agent does not provide a handler for the incoming message.";
    const char* const unknown = "org.freedesktop.DBus.Error.UnknownMethod";
    const struct {
        const char* member;
        const char* types;
        const char* answer;
        const char* log;
        const char* interface;
    } rows[] = {
        { "RequestPinCode", "o", "482913", "", "org.bluez.Agent" },
        { "RequestPasskey", "o", "482913", "", "org.bluez.Agent" },
        { "RequestConfirmation", "ou", "", "", "org.bluez.Agent" },
        { "Authorize", "os", "", "", "org.bluez.Agent" },
        { "Cancel", "", "", "", "org.bluez.Agent" },
        { "Release", "", "", "", "org.bluez.Agent" },
        // Not the agent's answers: libdbus answers what no handler took.
        { "DisplayPasskey", "ou", unknown, unhandled, "org.bluez.Agent" },
        { "ConfirmModeChange", "", unknown, unhandled, "org.bluez.Agent" },
        { "DisplayPinCode", "", unknown, unhandled, "org.bluez.Agent" },
        { "RequestPinCode", "o", unknown, unhandled, "org.bluez.Adapter" },
        { "Release", "", unknown, unhandled, "org.example.Other" },
        { "RequestPasskey", "", unknown, "agent.cpp:200 Failed to get argument from request passkey message.",
          "org.bluez.Agent" },
        { "RequestConfirmation", "", unknown,
          "agent.cpp:252 Failed to get argument from request confirmation message.", "org.bluez.Agent" },
        { "RequestConfirmation", "os", unknown,
          "agent.cpp:252 Failed to get argument from request confirmation message.", "org.bluez.Agent" },
        { "Authorize", "", unknown, "agent.cpp:293 Failed to get argument from authorize message.",
          "org.bluez.Agent" },
        // deliberate asymmetry: bad arguments of a PIN request count as handled, with no answer at all.
        { "RequestPinCode", "", "org.freedesktop.DBus.Error.NoReply",
          "agent.cpp:167 Failed to get argument from request pin code message.", "org.bluez.Agent" },
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(std::string(row.interface) + "." + row.member + "(" + row.types + ")");
        LogCapture log;
        auto start = std::chrono::steady_clock::now();
        EXPECT_EQ(callAsAPeer(me, agent.getPath(), row.member, 1000, row.types, row.interface), row.answer);
        if (*row.log == '\0') EXPECT_LT(std::chrono::steady_clock::now() - start, btbus_test::scaled(500ms));
        EXPECT_EQ(log.lines(), *row.log ? std::vector<std::string>{ row.log } : std::vector<std::string>{});
    }
}

TEST_F(APairing, AgentAnswersPeersOnTheReceivingThreadAndLogsWhatItCannotHandle) {
    sim::receivingLoop();
    ASSERT_EQ(agent.setPasskeyValue("482913"), 0);
    expectAnswersToPeers(adapter->getConnectionName(), agent);
    std::lock_guard<std::mutex> lock(gLock);
    EXPECT_EQ(std::count(gThreads.begin(), gThreads.end(), std::this_thread::get_id()), 0);
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
// the program's own.
TEST_F(APairing, WithoutAReceivingThreadIsAnsweredByTheThreadThatDispatches) {
    if (btbus_test::childRole() != "no-loop") {
        // Another receiving thread may already run here: run it in a fresh process.
        EXPECT_EQ(btbus_test::runInChild("APairing.WithoutAReceivingThreadIsAnsweredByTheThreadThatDispatches",
                                         "no-loop"),
                  0);
        return;
    }
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

    // A program's own loop, as a GLib main loop or plain libdbus runs it.
    DBusConnection* system = Connection::get(DBUS_BUS_SYSTEM);
    std::atomic<bool> dispatching{ true };
    std::thread::id loopThread;
    std::thread loop([&] {
        loopThread = std::this_thread::get_id();
        while (dispatching) dbus_connection_read_write_dispatch(system, 20);
    });
    ASSERT_TRUE(waitUntil([] {
        std::vector<std::string> seen = members();
        return std::count(seen.begin(), seen.end(), "Release") == 2;
    }));
    {
        std::lock_guard<std::mutex> lock(gLock);
        gMembers.clear();
        gThreads.clear();
    }
    ASSERT_EQ(agent.setPasskeyValue("482913"), 0);
    expectAnswersToPeers(adapter->getConnectionName(), agent);
    ASSERT_EQ(agent.setPasskeyDelay(1), 0);
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(callAsAPeer(adapter->getConnectionName(), agent.getPath(), "RequestPinCode", 3000, "o"), "482913");
    EXPECT_GE(std::chrono::steady_clock::now() - start, 1s);
    dispatching = false;
    loop.join();
    {
        std::lock_guard<std::mutex> lock(gLock);
        EXPECT_EQ(gThreads.size(), 17u);
        EXPECT_EQ(std::count(gThreads.begin(), gThreads.end(), loopThread), 17);
    }
    // The same through a GLib main loop that the connection is attached to.
    dbus_connection_setup_with_g_main(system, nullptr);
    GMainLoop* glibLoop = g_main_loop_new(nullptr, FALSE);
    std::thread glib([glibLoop] { g_main_loop_run(glibLoop); });
    EXPECT_EQ(callAsAPeer(adapter->getConnectionName(), agent.getPath(), "RequestPasskey", 3000, "o"), "482913");
    EXPECT_EQ(callAsAPeer(adapter->getConnectionName(), agent.getPath(), "DisplayPasskey", 3000, "ou"),
              "org.freedesktop.DBus.Error.UnknownMethod");
    g_main_loop_quit(glibLoop);
    glib.join();
    g_main_loop_unref(glibLoop);
    Connection::unref(system);
}

TEST_F(APairing, AgentAnswersAnIncomingPinRequestLeavingOtherCallsPromptAndIsReleasedWhenUnregistered) {
    ASSERT_EQ(agent.setPasskeyValue("0000"), 0);
    ASSERT_EQ(agent.setPasskeyDelay(2), 0);
    ASSERT_NO_FATAL_FAILURE(registerWithAdapter());
    // The receiving thread sleeps in the agent's answer meanwhile.
    std::thread pairing([] { EXPECT_EQ(sim::startIncomingPairing("hci0", kKeyboard), "accepted"); });
    ASSERT_TRUE(waitUntil([] { return reached("RequestPinCode"); }));
    std::unique_ptr<Adapter> other(Adapter::getAdapter(adapter->getPath()));
    for (int i = 0; i < 5; ++i) {
        auto start = std::chrono::steady_clock::now();
        std::unique_ptr<Dict> properties(other->getProperties());
        EXPECT_TRUE(properties != nullptr);
        EXPECT_LT(std::chrono::steady_clock::now() - start, btbus_test::scaled(250ms)) << "call " << i;
    }
    pairing.join();
    ASSERT_EQ(adapter->unregisterAgent(agent), 0);
    EXPECT_TRUE(waitUntil([] { return reached("Release"); }));
    EXPECT_EQ(agentCalls(), (std::vector<std::string>{
                                call("RequestPinCode(" + sim::devicePath(kKeyboard) + ") -> 0000"),
                                call("Release() -> sent") }));
}

}  // namespace
