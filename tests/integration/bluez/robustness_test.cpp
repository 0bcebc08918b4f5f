// A rogue peer's odd signals, and bluetoothd going away between calls, dying or
// hanging during them.
#include <algorithm>
#include <atomic>
#include <chrono>
#include <functional>
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

std::atomic<int> gFound{ 0 };
void countFound(RemoteObject*, const char*, const Dict*) { ++gFound; }

// bluetoothd hangs or dies while a blocking call and a pairing (a pending call
// that serves the agent) wait, each on a thread of its own, and discovery runs
// beside the receiving thread.
class ABluetoothdInTrouble : public SimTest {
protected:
    void SetUp() override {
        SimTest::SetUp();
        sim::receivingLoop();
        adapter.reset(Adapter::getAdapter(sim::defaultAdapterPath().c_str()));
        ASSERT_NE(adapter, nullptr);
        ASSERT_EQ(agent.registerPath(), 0);
        discover(*adapter);
    }
    void TearDown() override { agent.unregisterPath(); }

    static void discover(Adapter& on) {
        int before = gFound;
        ASSERT_EQ(on.setDeviceFoundHandler(&countFound), 0);
        ASSERT_EQ(on.startDiscovery(), 0);
        EXPECT_TRUE(waitUntil([before] { return gFound > before; }, 10s)) << "no discovery";
    }

    // How long the blocking call and the pairing waited, sent to a frozen
    // bluetoothd before what happens meanwhile; both fail with error 11.
    std::vector<std::chrono::steady_clock::duration> waitsWhile(const std::function<void()>& meanwhile) {
        std::vector<std::chrono::steady_clock::duration> waits(2);
        std::unique_ptr<Adapter> caller(Adapter::getAdapter(adapter->getPath()));  // a proxy per thread
        sim::freeze(true);
        auto timed = [&waits](size_t i, Adapter* on, const std::function<bool()>& failed) {
            auto start = std::chrono::steady_clock::now();
            EXPECT_TRUE(failed());
            waits[i] = std::chrono::steady_clock::now() - start;
            EXPECT_EQ(on->getErrorNumber(), 11);
        };
        std::thread call(timed, 0, caller.get(), [&] { return std::unique_ptr<Dict>(caller->getProperties()) == nullptr; });
        std::thread pairing(timed, 1, adapter.get(),
                            [&] { return std::unique_ptr<Device>(adapter->createPairedDevice(sim::kKeyboard, agent)) == nullptr; });
        std::this_thread::sleep_for(300ms);
        meanwhile();
        call.join();
        pairing.join();
        return waits;
    }

    std::unique_ptr<Adapter> adapter;
    Agent agent;
};

TEST_F(ABluetoothdInTrouble, ThatHangsEndsTheWaitsAtTheDefaultTimeOutAndServesAgainWhenItWakes) {
    for (auto waited : waitsWhile([] {})) {
        EXPECT_GE(waited, 24s);
        EXPECT_LT(waited, btbus_test::scaled(35s));
    }
    int before = gFound;
    sim::freeze(false);
    EXPECT_TRUE(waitUntil([before] { return gFound > before; }, 10s)) << "discovery did not go on";
    EXPECT_TRUE(std::unique_ptr<Dict>(adapter->getProperties()) != nullptr);
}

TEST_F(ABluetoothdInTrouble, ThatDiesEndsTheWaitsAtOnceAndANewOneServes) {
    LogCapture log;
    for (auto waited : waitsWhile([] { sim::kill(); }))
        EXPECT_LT(waited, btbus_test::scaled(5s)) << "waited for a time-out instead of the bus's notice";
    const std::vector<std::string> lines = log.lines();
    EXPECT_EQ(std::count(lines.begin(), lines.end(), "adapter.cpp:312 " + adapter->getErrorMessage()), 1);
    ASSERT_TRUE(sim::start());
    std::unique_ptr<Adapter> fresh(Adapter::getAdapter(sim::defaultAdapterPath().c_str()));
    ASSERT_NE(fresh, nullptr);
    discover(*fresh);
}

}  // namespace
