// Manager, Adapter, Device, Audio, AudioSink and Control against bluez4-sim:
// one-way requests through the call log, queries, signals through the handlers
// and the default ones, hciconfig's part, and bluetoothd dying or hanging while
// calls wait for it.
#include <algorithm>
#include <atomic>
#include <chrono>
#include <fstream>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <bluetooth/btbus.h>

#include "support/log_capture.h"
#include "support/namespace.h"
#include "support/process.h"
#include "support/sim.h"

namespace {

using namespace Bluetooth;
using namespace btbus_test;
using sim::kFarLaptop, sim::kHeadset, sim::kKeyboard, sim::kMouse, sim::kPhone;

const char kSecondAddress[] = "00:1A:7D:DA:71:14";

// Standard output while running, once signals counted by the handlers reached
// count: the default handlers' lines ("" when they do not arrive).
std::atomic<int> gSignals{ 0 };
std::string printedUntil(int count, const std::function<void()>& run) {
    gSignals = 0;
    testing::internal::CaptureStdout();
    run();
    bool arrived = waitUntil([count] { return gSignals >= count; });
    std::string out = testing::internal::GetCapturedStdout();
    EXPECT_TRUE(arrived) << out;
    return arrived ? out : "";
}
bool printed(const std::string& out, const std::string& line) { return out.find(line) != std::string::npos; }

// The path of the proxy, or the paths of the list, that a call returned, which
// these then destroy: "none" for a null one.
std::string pathOf(RemoteObject* returned) {
    std::unique_ptr<RemoteObject> owned(returned);
    return owned ? owned->getPath() : "none";
}
template <typename List>
std::vector<std::string> pathsOf(List* returned) {
    std::unique_ptr<List> owned(returned);
    std::vector<std::string> paths;
    for (size_t i = 0; owned && i < owned->size(); ++i) paths.push_back((*owned)[i]->getPath());
    return owned ? paths : std::vector<std::string>{ "none" };
}

class AManager : public SimTest {
protected:
    void SetUp() override {
        SimTest::SetUp();
        manager.reset(Manager::getManager());
        ASSERT_NE(manager, nullptr);
        defaultPath = sim::defaultAdapterPath();
        ASSERT_FALSE(defaultPath.empty());
    }
    std::unique_ptr<Manager> manager;
    std::string defaultPath;
};

TEST_F(AManager, FindsListsAndIndexesItsAdaptersLoggingWhatBluezCannotFind) {
    EXPECT_EQ(pathOf(manager->defaultAdapter()), defaultPath);
    std::string second = sim::addAdapter("hci1", kSecondAddress);
    EXPECT_EQ(pathOf(manager->findAdapter(kSecondAddress)), second);
    EXPECT_EQ(pathsOf(manager->listAdapters()), (std::vector<std::string>{ defaultPath, second }));
    EXPECT_EQ(pathOf(manager->getAdapterByIndex(1)), second);
    sim::clearCallLog();
    EXPECT_EQ(pathOf(manager->getAdapterByIndex(2)), defaultPath);  // past the end: the default one
    EXPECT_EQ(sim::logLinesWith("org.bluez.Manager."),
              (std::vector<std::string>{ "/ org.bluez.Manager.ListAdapters()", "/ org.bluez.Manager.DefaultAdapter()" }));
    EXPECT_FALSE(manager->hasError());
    LogCapture log;
    EXPECT_EQ(manager->findAdapter("hci7"), nullptr);
    EXPECT_EQ(manager->getErrorNumber(), 11);
    EXPECT_EQ(sim::logLinesWith("org.bluez.Manager.FindAdapter(hci7)").size(), 1u);
    EXPECT_EQ(pathsOf(manager->listAdapters()).size(), 2u);
    EXPECT_EQ(manager->getErrorNumber(), 11) << "the error of findAdapter was cleared";
    // Without adapters, the default that getAdapterByIndex falls back to does not exist.
    sim::removeAdapter("hci0");
    sim::removeAdapter("hci1");
    EXPECT_EQ(pathsOf(manager->listAdapters()), std::vector<std::string>{});
    EXPECT_EQ(manager->getAdapterByIndex(0), nullptr);
    EXPECT_EQ(manager->defaultAdapter(), nullptr);
    EXPECT_EQ(log.lines(), (std::vector<std::string>{ "manager.cpp:156 No such adapter", "manager.cpp:96 No such adapter",
                                                      "manager.cpp:96 No such adapter" }));
}

void countPath(RemoteObject*, const ObjectPath*) { ++gSignals; }
void countBluetoothd(RemoteObject*, bool) { ++gSignals; }

// A new bluetoothd takes the name, then announces its adapters at new paths.
TEST_F(AManager, ReportsAdaptersAndBluetoothdComingAndGoing) {
    sim::receivingLoop();
    for (bool byDefault : { true, false }) {
        ASSERT_EQ(manager->setAdapterAddedHandler(byDefault ? nullptr : &countPath), 0);
        ASSERT_EQ(manager->setDefaultAdapterChangedHandler(byDefault ? nullptr : &countPath), 0);
        ASSERT_EQ(manager->setAdapterRemovedHandler(byDefault ? nullptr : &countPath), 0);
        ASSERT_EQ(manager->setBluetoothdHandler(byDefault ? nullptr : &countBluetoothd), 0);
    }
    std::string second, renewed;
    std::string out = printedUntil(6, [&] {
        sim::removeAdapter("hci0");  // default gone, no other adapter: no DefaultAdapterChanged
        second = sim::addAdapter("hci1", kSecondAddress);
        sim::kill();
        EXPECT_TRUE(sim::start());
        renewed = sim::defaultAdapterPath();
    });
    EXPECT_EQ(out, defaultPath + " was removed by /\n" + second + " was added by /\n" + "Default adpater is " + second +
                       " in / now\nbluetoothd left the system bus\nbluetoothd is on the system bus\n" + renewed +
                       " was added by /\n");
}

class AnAdapter : public SimTest {
protected:
    void SetUp() override {
        SimTest::SetUp();
        path = sim::defaultAdapterPath();
        adapter.reset(Adapter::getAdapter(path.c_str()));
        ASSERT_NE(adapter, nullptr);
    }
    std::string path;
    std::unique_ptr<Adapter> adapter;
};

TEST_F(AnAdapter, FindsCreatesAndListsItsDevicesLoggingWhyItCannotButAnUnknownAddressOnlyWhenAsked) {
    std::unique_ptr<Device> mouse(adapter->findDevice(kMouse, true));
    ASSERT_NE(mouse, nullptr);
    EXPECT_EQ(mouse->getPath(), sim::devicePath(kMouse));
    std::unique_ptr<Dict> services(mouse->discoverServices("hid"));  // of its HID and PnP records
    ASSERT_TRUE(services != nullptr);
    ASSERT_EQ(services->size(), 1u);
    EXPECT_EQ(variantToString(services->front().second).compare(0, 5, "<?xml"), 0);
    EXPECT_EQ(pathOf(adapter->createDevice(kPhone)), sim::devicePath(kPhone));
    LogCapture log;
    EXPECT_EQ(adapter->findDevice(kKeyboard, false), nullptr);
    EXPECT_EQ(adapter->getErrorNumber(), 11);
    EXPECT_TRUE(log.lines().empty());
    EXPECT_EQ(adapter->findDevice(kKeyboard, true), nullptr);
    EXPECT_EQ(adapter->createDevice(kPhone), nullptr);
    EXPECT_EQ(adapter->getErrorName(), "org.bluez.Error.AlreadyExists");
    EXPECT_EQ(adapter->createDevice(kFarLaptop), nullptr);
    EXPECT_EQ(adapter->createDevice("not an address"), nullptr);
    EXPECT_EQ(log.lines(), (std::vector<std::string>{ "adapter.cpp:180 Does Not Exist", "adapter.cpp:274 Already Exists",
                                                      "adapter.cpp:274 Host is down",
                                                      "adapter.cpp:274 Invalid arguments in method call" }));
    log.clear();
    std::vector<std::string> paths = pathsOf(adapter->listDevices());
    EXPECT_EQ(paths, (std::vector<std::string>{ pathOf(adapter->getDeviceByIndex(0)),
                                                pathOf(adapter->getDeviceByIndex(1)) }));
    std::sort(paths.begin(), paths.end());
    EXPECT_EQ(paths, (std::vector<std::string>{ mouse->getPath(), sim::devicePath(kPhone) }));
    EXPECT_EQ(adapter->getDeviceByIndex(2), nullptr);
    EXPECT_FALSE(adapter->hasError());
    EXPECT_TRUE(log.lines().empty());
    ASSERT_TRUE(sim::start());  // the mouse alone again: the phone's link keeps it a while
    ASSERT_EQ(adapter->removeDevice(mouse->getPath()), 0);
    ASSERT_TRUE(sim::waitForLogLine("RemoveDevice"));
    EXPECT_EQ(pathsOf(adapter->listDevices()), std::vector<std::string>{});
    EXPECT_EQ(adapter->getDeviceByIndex(0), nullptr);
}

void countAddress(RemoteObject*, const char*) { ++gSignals; }
void countRenamed(RemoteObject*, const char* name, const Variant*) { gSignals += std::string(name) == "Name"; }

TEST_F(AnAdapter, PrintsItsSignalsThroughTheDefaultHandlersBesideOthers) {
    sim::receivingLoop();
    ASSERT_EQ(adapter->setDeviceCreatedHandler(nullptr), 0);
    ASSERT_EQ(adapter->setDeviceRemovedHandler(nullptr), 0);
    ASSERT_EQ(adapter->setDeviceFoundHandler(nullptr), 0);
    for (bool byDefault : { true, false }) {
        ASSERT_EQ(adapter->setPropertyChangedHandler(byDefault ? nullptr : &countRenamed), 0);
        ASSERT_EQ(adapter->setDeviceDisappearedHandler(byDefault ? nullptr : &countAddress), 0);
    }
    std::string out = printedUntil(1, [&] {
        EXPECT_EQ(adapter->startDiscovery(), 0);
        EXPECT_TRUE(sim::waitForLogLine("StartDiscovery"));
        sim::setInRange("hci0", kPhone, false);
    });
    EXPECT_TRUE(printed(out, std::string(kKeyboard) + " was found by " + path + "\nAddress: " + kKeyboard + "\n"))
        << out;
    EXPECT_FALSE(printed(out, std::string(kFarLaptop) + " was found")) << out;
    EXPECT_TRUE(printed(out, std::string(kPhone) + " was disappeared in " + path + "\n")) << out;
    const std::string mouse = sim::devicePath(kMouse), phone = sim::devicePath(kPhone);
    out = printedUntil(1, [&] {
        adapter->stopDiscovery();
        sim::setInRange("hci0", kPhone, true);  // the simulator's Reset keeps the range
        EXPECT_EQ(pathOf(adapter->createDevice(kPhone)), phone);
        adapter->removeDevice(mouse.c_str());
        adapter->setProperty("Name", Variant(std::string("renamed")));
    });
    EXPECT_TRUE(printed(out, phone + " was created by " + path + "\n")) << out;
    EXPECT_TRUE(printed(out, mouse + " was removed by " + path + "\n")) << out;
    EXPECT_TRUE(printed(out, "Name was changed in " + path + " with renamed\n")) << out;
}

// The stand-ins for /usr/bin/hciconfig are put in place in a private namespace
// (an overlay on /usr/bin), in a child run of this binary, so the host's
// /usr/bin is never touched.
const char kHciconfig[] = "/usr/bin/hciconfig";

TEST(AnAdaptersProperties, EndWithTheHciVersionThatHciconfigPrints) {
    BTBUS_IN_PRIVATE_NAMESPACE();
    std::string why;
    ASSERT_TRUE(overlay("/usr/bin", why)) << why;
    ASSERT_TRUE(sim::start());
    // Not the default adapter: the controller's name is the last component of its path.
    std::unique_ptr<Adapter> adapter(Adapter::getAdapter(sim::addAdapter("hci1", kSecondAddress).c_str()));
    ASSERT_NE(adapter, nullptr);
    std::unique_ptr<Dict> plain(adapter->BluezObject::getProperties());
    ASSERT_TRUE(plain != nullptr);
    const std::string argsFile = scratchDir() + "/hciconfig-args";
    const struct {
        const char* name;
        std::string script;   // the stand-in's, "" for none at all
        bool executable;
        const char* version;  // the entry's value, null when it is left out
    } cases[] = {
        { "a version line among others: its first word", "echo \"$@\" > " + argsFile + "\n" +
          "printf 'hci1:\\tType: Primary  Bus: USB\\n\\tBD Address: 00:1A:7D:DA:71:14  ACL MTU: 310:10\\n'\n"
          "printf '\\tHCI Version: 2.1 (0x4)  Revision: 0x1234\\n\\tHCI Version: 4.0 (0x6)  Revision: 0x1\\n'\n",
          true, "2.1" },
        { "one that hangs after its version line, killed after a short grace",
          "printf '\\tHCI Version: 3.0 (0x5)\\n'\nexec sleep 6\n", true, "3.0" },
        { "no version line: the entry empty", "printf 'hci1:\\tType: Primary  Bus: USB\\n\\tHCI Ver: 2.1\\n'\n", true,
          "" },
        { "none", "", false, nullptr },
        { "one that cannot be run", "echo '\tHCI Version: 9.9'\n", false, nullptr },
    };
    const std::vector<std::string> failed{ "adapter.cpp:438 Failed to get open(/usr/bin/hciconfig hci1)" };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        unlink(kHciconfig);
        if (!c.script.empty()) std::ofstream(kHciconfig) << "#!/bin/sh\n" << c.script;
        if (c.executable) chmod(kHciconfig, 0755);
        LogCapture log;
        auto start = std::chrono::steady_clock::now();
        std::unique_ptr<Dict> properties(adapter->getProperties());
        EXPECT_LT(std::chrono::steady_clock::now() - start, scaled(2s));
        ASSERT_TRUE(properties != nullptr);
        Dict expected(*plain);
        if (c.version) expected.push_back(Entry("HCIVersion", Variant(std::string(c.version))));
        EXPECT_TRUE(*properties == expected) << dictToString(*properties);
        EXPECT_EQ(log.lines(), c.version ? std::vector<std::string>{} : failed);
    }
    std::string line;
    std::getline(std::ifstream(argsFile), line);
    EXPECT_EQ(line, "hci1 -a");
}

class AnAudioDevice : public AnAdapter {
protected:
    void SetUp() override {
        AnAdapter::SetUp();
        device.reset(adapter->createDevice(kHeadset));
        ASSERT_NE(device, nullptr);
        headset = device->getPath();
        sink.reset(AudioSink::getAudioSink(headset.c_str()));
        control.reset(Control::getControl(headset.c_str()));
        audio.reset(Audio::getAudio(headset.c_str()));
        ASSERT_TRUE(sink && control && audio);
    }
    std::unique_ptr<Device> device;
    std::string headset;
    std::unique_ptr<AudioSink> sink;
    std::unique_ptr<Control> control;
    std::unique_ptr<Audio> audio;
};

TEST_F(AnAudioDevice, AndItsAdapterSendTheirOneWayRequestsInOrderWithoutWaitingForBluez) {
    Agent agent;
    ASSERT_EQ(agent.registerPath(), 0);
    const std::string mouse = sim::devicePath(kMouse), agentPath = agent.getPath();
    const std::string a = path + " org.bluez.Adapter.", d = headset + " org.bluez.Device.",
                      au = headset + " org.bluez.Audio.", c = headset + " org.bluez.Control.";
    const struct {
        std::function<int()> send;
        std::string logged;  // by the simulator
    } requests[] = {
        { [&] { return adapter->registerAgent(agent); }, a + "RegisterAgent(" + agentPath + ", DisplayYesNo)" },
        { [&] { return adapter->requestSession(); }, a + "RequestSession()" },
        { [&] { return adapter->startDiscovery(); }, a + "StartDiscovery()" },
        { [&] { return adapter->stopDiscovery(); }, a + "StopDiscovery()" },
        { [&] { return adapter->releaseSession(); }, a + "ReleaseSession()" },
        { [&] { return adapter->setProperty("Name", Variant(std::string("btbus test"))); },
          a + "SetProperty(Name, btbus test)" },
        // Refused: nothing in progress.
        { [&] { return adapter->cancelDeviceCreation(kKeyboard); }, a + "CancelDeviceCreation(" + kKeyboard + ")" },
        { [&] { return device->cancelDiscovery(); }, d + "CancelDiscovery()" },
        { [&] { return device->setProperty("Trusted", Variant(false)); }, d + "SetProperty(Trusted, false)" },
        { [&] { return device->setProperty("Alias", Variant(3u)); }, d + "SetProperty(Alias, 3)" },  // refused: type
        // Text goes as a string.
        { [&] { return device->setProperty("Alias", "kitchen-nas"); }, d + "SetProperty(Alias, kitchen-nas)" },
        { [&] { return audio->connect(); }, au + "Connect()" },
        { [&] { return audio->connect(); }, au + "Connect()" },  // refused: already connecting
        { [&] { return control->volumeUp(); }, c + "VolumeUp()" },
        { [&] { return control->volumeDown(); }, c + "VolumeDown()" },
        { [&] { return audio->disconnect(); }, au + "Disconnect()" },
        { [&] { return adapter->removeDevice(mouse.c_str()); }, a + "RemoveDevice(" + mouse + ")" },
        { [&] { return adapter->setProperty("Powered", Variant(false)); }, a + "SetProperty(Powered, false)" },
        { [&] { return adapter->startDiscovery(); }, a + "StartDiscovery()" },  // refused: the adapter is off
        { [&] { return adapter->setProperty("Class", Variant(7u)); }, a + "SetProperty(Class, 7)" },  // read-only
        { [&] { return adapter->unregisterAgent(agent); }, a + "UnregisterAgent(" + agentPath + ")" },
    };
    sim::clearCallLog();
    LogCapture log;
    std::vector<std::string> expected;
    for (const auto& request : requests) {
        EXPECT_EQ(request.send(), 0) << request.logged;
        expected.push_back(request.logged);
    }
    ASSERT_TRUE(sim::waitForLogLine("UnregisterAgent"));
    EXPECT_EQ(sim::logLinesWith(path), expected);
    EXPECT_TRUE(log.lines().empty());
    EXPECT_EQ(agent.unregisterPath(), 0);
}

void countNoArgument(RemoteObject*) { ++gSignals; }

// Argument-less signals reach handlers with the dispatching object: the
// default ones print the receiving thread's proxy's path.
TEST_F(AnAudioDevice, ReportsWhetherItsProfilesAreConnectedAndPrintsTheirAndTheDevicesSignals) {
    const std::string from = sim::receivingLoop()->getPath();
    ASSERT_EQ(sink->setConnectedHandler(nullptr), 0);
    ASSERT_EQ(sink->setPlayingHandler(nullptr), 0);
    ASSERT_EQ(sink->setStoppedHandler(nullptr), 0);
    ASSERT_EQ(sink->setDisconnectedHandler(nullptr), 0);
    ASSERT_EQ(control->setConnectedHandler(nullptr), 0);
    ASSERT_EQ(device->setDisconnectRequestedHandler(nullptr), 0);
    ASSERT_EQ(device->setDisconnectRequestedHandler(&countNoArgument), 0);
    // 1 connected, 0 not, -1 when the query fails.
    auto state = [](auto& profile) {
        bool connected = true;
        return profile->isConnected(connected) == 0 ? int(connected) : -1;
    };
    EXPECT_EQ(state(sink), 0);
    EXPECT_EQ(state(control), 0);
    std::string out = printedUntil(1, [&] {
        EXPECT_EQ(sink->connect(), 0);
        EXPECT_TRUE(waitUntil([&] { return state(sink) == 1 && state(control) == 1; }));
        sim::setPlaying("hci0", kHeadset, true);
        sim::setPlaying("hci0", kHeadset, false);
        EXPECT_EQ(sink->disconnect(), 0);
        EXPECT_EQ(adapter->removeDevice(headset.c_str()), 0);  // the link is still up: a disconnect request first
    });
    // The sink's and the control's "Connected" are told apart by interface: two lines.
    size_t first = out.find("Connected from " + from + "\n");
    EXPECT_NE(first, std::string::npos) << out;
    EXPECT_NE(out.find("Connected from " + from + "\n", first + 1), std::string::npos) << out;
    EXPECT_TRUE(printed(out, "Playing in " + from + "\nStopped in " + from + "\n")) << out;
    EXPECT_TRUE(printed(out, "Disconnected from " + from + "\n")) << out;
    EXPECT_TRUE(printed(out, "Disconnect requested from " + from + "\n")) << out;
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
                            [&] { return std::unique_ptr<Device>(adapter->createPairedDevice(kKeyboard, agent)) == nullptr; });
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
        EXPECT_LT(waited, scaled(35s));
    }
    int before = gFound;
    sim::freeze(false);
    EXPECT_TRUE(waitUntil([before] { return gFound > before; }, 10s)) << "discovery did not go on";
    EXPECT_TRUE(std::unique_ptr<Dict>(adapter->getProperties()) != nullptr);
}

TEST_F(ABluetoothdInTrouble, ThatDiesEndsTheWaitsAtOnceFailsWhatFollowsCleanlyAndANewOneServes) {
    std::unique_ptr<Device> mouse(adapter->findDevice(kMouse, true));
    std::unique_ptr<Manager> manager(Manager::getManager());
    std::unique_ptr<AudioSink> sink(AudioSink::getAudioSink(sim::devicePath(kMouse).c_str()));
    ASSERT_TRUE(mouse && manager && sink);
    LogCapture log;
    for (auto waited : waitsWhile([] { sim::kill(); }))
        EXPECT_LT(waited, scaled(5s)) << "waited for a time-out instead of the bus's notice";
    EXPECT_EQ(log.count("adapter.cpp:312 " + adapter->getErrorMessage()), 1u);
    log.clear();
    // Asking the bus daemon whether bluetoothd runs succeeds: nothing to log.
    EXPECT_FALSE(BluezObject::hasBluetoothd());
    EXPECT_EQ(Manager::getManager(), nullptr);
    EXPECT_EQ(Adapter::getAdapter(adapter->getPath()), nullptr);
    EXPECT_EQ(Device::getDevice(mouse->getPath()), nullptr);
    EXPECT_EQ(Audio::getAudio(mouse->getPath()), nullptr);
    EXPECT_EQ(AudioSink::getAudioSink(mouse->getPath()), nullptr);
    EXPECT_EQ(Control::getControl(mouse->getPath()), nullptr);
    DBusObject bus;
    std::unique_ptr<std::vector<std::string> > names(bus.listNames());
    ASSERT_NE(names, nullptr);
    EXPECT_FALSE(names->empty()) << "the test's own connection is on the bus";
    EXPECT_EQ(manager->defaultAdapter(), nullptr);
    EXPECT_EQ(manager->listAdapters(), nullptr);
    EXPECT_EQ(adapter->getProperties(), nullptr);
    EXPECT_EQ(mouse->discoverServices(""), nullptr);
    bool connected = true;
    EXPECT_EQ(sink->isConnected(connected), -1);
    for (RemoteObject* o : std::vector<RemoteObject*>{ manager.get(), adapter.get(), mouse.get(), sink.get() })
        EXPECT_EQ(o->getErrorNumber(), 11) << o->getInterface();
    EXPECT_EQ(adapter->startDiscovery(), 0) << "one-way requests only report that they were sent";
    EXPECT_EQ(log.lines().size(), 4u);  // every waiting operation but listAdapters
    ASSERT_TRUE(sim::start());
    std::unique_ptr<Adapter> fresh(Adapter::getAdapter(sim::defaultAdapterPath().c_str()));
    ASSERT_NE(fresh, nullptr);
    discover(*fresh);
}

}  // namespace
