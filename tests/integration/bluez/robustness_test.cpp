// A rogue peer's odd signals, and bluetoothd going away between and during calls.
#include <atomic>
#include <chrono>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include <bluetooth/btbus.h>

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

std::atomic<int> gGood{ 0 };
std::atomic<int> gAny{ 0 };
void goodChange(RemoteObject*, const char* name, const Variant*) {
    ++gAny;
    if (std::string(name) == "Good") ++gGood;
}
void anyFound(RemoteObject*, const char*, const Dict*) { ++gAny; }
void anyAddress(RemoteObject*, const char*) { ++gAny; }
void anyPath(RemoteObject*, const ObjectPath*) { ++gAny; }

TEST_F(SimTest, OddSignalsOnTheProxiesInterfacesAreLoggedAndIgnored) {
    sim::receivingLoop();
    std::string path = sim::defaultAdapterPath();
    std::unique_ptr<Adapter> adapter(Adapter::getAdapter(path.c_str()));
    std::unique_ptr<Manager> manager(Manager::getManager());
    ASSERT_TRUE(adapter && manager);
    gGood = 0;
    gAny = 0;
    ASSERT_EQ(adapter->setPropertyChangedHandler(&goodChange), 0);
    ASSERT_EQ(adapter->setDeviceFoundHandler(&anyFound), 0);
    ASSERT_EQ(adapter->setDeviceDisappearedHandler(&anyAddress), 0);
    ASSERT_EQ(adapter->setDeviceCreatedHandler(&anyPath), 0);
    ASSERT_EQ(manager->setAdapterAddedHandler(&anyPath), 0);
    LogCapture log;
    const char* kAdapter = "org.bluez.Adapter";
    struct Rogue {
        const char* interface;
        const char* member;
        const char* signature;
        const char* args;
        const char* logged;
    };
    const std::vector<Rogue> rogues = {
        { kAdapter, "PropertyChanged", "sv", R"(["Powered", ["d", 1.5]])", "Failed to parse variant in signal" },
        { kAdapter, "PropertyChanged", "sv", R"(["Powered", ["y", 7]])", "Failed to parse variant in signal" },
        { kAdapter, "PropertyChanged", "", "[]", "Signal has no arguments" },
        { kAdapter, "PropertyChanged", "us", R"([1, "Powered"])", "Argument is not string" },
        { kAdapter, "DeviceFound", "sv", R"(["00:11:22:33:44:55", ["b", true]])", "Argument is not dict" },
        { kAdapter, "DeviceFound", "sa{sv}", R"(["00:11:22:33:44:55", {"RSSI": ["d", -1.5]}])",
          "Failed to parse entry value" },
        { kAdapter, "DeviceDisappeared", "u", "[5]", "Argument is not string" },
        { kAdapter, "DeviceCreated", "s", R"(["/not/a/path/argument"])", "Argument is not object path" },
        { "org.bluez.Manager", "AdapterAdded", "", "[]", "Signal has no arguments" },
    };
    for (const Rogue& r : rogues)  // from the paths the proxies' match rules name
        sim::emitSignal(r.interface == kAdapter ? path : "/", r.interface, r.member, r.signature, r.args);
    sim::emitSignal(path, kAdapter, "PropertyChanged", "sv", R"(["Good", ["b", true]])");
    ASSERT_TRUE(waitUntil([] { return gGood == 1; })) << "the receiving thread stopped";
    EXPECT_EQ(gAny, 1) << "a handler was given an odd signal";
    for (const Rogue& r : rogues)
        EXPECT_GE(log.countEndingWith(r.logged), 1u) << r.member << " " << r.signature;
    EXPECT_EQ(log.lines().size(), rogues.size()) << ::testing::PrintToString(log.lines());
}

TEST_F(SimTest, AProxyFailsCleanlyWhenBluetoothdIsGoneBetweenCalls) {
    std::string path = sim::defaultAdapterPath();
    std::unique_ptr<Manager> manager(Manager::getManager());
    std::unique_ptr<Adapter> adapter(Adapter::getAdapter(path.c_str()));
    std::unique_ptr<Device> mouse(adapter->findDevice("00:1F:20:AB:CD:EF", true));
    std::unique_ptr<AudioSink> sink(AudioSink::getAudioSink(mouse->getPath()));
    ASSERT_TRUE(manager && adapter && mouse && sink);
    sim::kill();
    LogCapture log;
    EXPECT_EQ(manager->defaultAdapter(), nullptr);
    EXPECT_EQ(manager->listAdapters(), nullptr);
    EXPECT_EQ(adapter->getProperties(), nullptr);
    EXPECT_EQ(adapter->listDevices(), nullptr);
    EXPECT_EQ(adapter->createDevice("5C:F3:70:61:A0:17"), nullptr);
    EXPECT_EQ(mouse->discoverServices(""), nullptr);
    bool connected = true;
    EXPECT_EQ(sink->isConnected(connected), -1);
    for (RemoteObject* o : std::vector<RemoteObject*>{ manager.get(), adapter.get(), mouse.get(), sink.get() })
        EXPECT_EQ(o->getErrorNumber(), 11) << o->getInterface();
    EXPECT_EQ(adapter->startDiscovery(), 0) << "one-way requests only report that they were sent";
    EXPECT_EQ(log.lines().size(), 6u);  // every waiting operation but listAdapters
    Agent agent;
    ASSERT_EQ(agent.registerPath(), 0);
    EXPECT_EQ(adapter->createPairedDevice("00:12:A1:B0:00:42", agent), nullptr);
    EXPECT_EQ(adapter->getErrorNumber(), 11);
    EXPECT_EQ(agent.unregisterPath(), 0);
    EXPECT_EQ(Adapter::getAdapter(path.c_str()), nullptr);
}

std::atomic<bool> gAsked{ false };
DBusHandlerResult noteAsked(DBusConnection* connection, DBusMessage* message, void* agent) {
    gAsked = true;
    return Agent::handlerDispatcher(connection, message, agent);
}

TEST_F(SimTest, APairingFailsCleanlyWhenBluetoothdDiesDuringIt) {
    std::unique_ptr<Adapter> adapter(Adapter::getAdapter(sim::defaultAdapterPath().c_str()));
    ASSERT_NE(adapter, nullptr);
    Agent agent;
    ASSERT_EQ(agent.setDispatcher(&noteAsked), 0);
    ASSERT_EQ(agent.setPasskeyValue("0000"), 0);
    ASSERT_EQ(agent.setPasskeyDelay(1), 0);
    ASSERT_EQ(agent.registerPath(), 0);
    gAsked = false;
    std::thread killer([] {
        EXPECT_TRUE(waitUntil([] { return gAsked.load(); }));
        sim::kill();  // while the agent thinks
    });
    LogCapture log;
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(adapter->createPairedDevice("00:12:A1:B0:00:42", agent), nullptr);
    auto took = std::chrono::steady_clock::now() - start;
    killer.join();
    EXPECT_EQ(adapter->getErrorNumber(), 11);
    EXPECT_FALSE(adapter->getErrorMessage().empty());
    EXPECT_EQ(log.lines(), std::vector<std::string>{ "adapter.cpp:312 " + adapter->getErrorMessage() });
    EXPECT_LT(took, btbus_test::scaled(10s)) << "waited for a time-out instead of the bus's notice";
    EXPECT_EQ(agent.unregisterPath(), 0);
}

}  // namespace
