#ifndef BTBUS_TESTS_SUPPORT_SIM_H
#define BTBUS_TESTS_SUPPORT_SIM_H

#include <string>
#include <vector>

#include <gtest/gtest.h>

namespace Bluetooth {
class RemoteObject;
}

namespace btbus_test {

// bluez4-sim as "org.bluez" on the private system bus of this test binary,
// started by the first test that needs it and stopped before the buses go.
// Failures of the control calls fail the current test.
namespace sim {

// Starts the simulator unless it runs, and resets its scene and call log.
// Call in every SetUp; returns whether it runs (false with a failure added).
bool start();
// Kills the simulator (SIGKILL: no goodbye on the bus) and waits until
// "org.bluez" has no owner.
void kill();
// Freezes the simulator (SIGSTOP), as a hung bluetoothd: it neither answers
// nor leaves the bus; or thaws it (SIGCONT).
void freeze(bool frozen);

// The devices of the default scene (tools/bluez4-sim/default-scene.json).
constexpr const char kHeadset[] = "00:0D:3C:A1:B2:C3";    // audio sink and remote control
constexpr const char kKeyboard[] = "00:12:A1:B0:00:42";   // legacy: PIN "0000"
constexpr const char kPhone[] = "5C:F3:70:61:A0:17";      // passkey 482913
constexpr const char kFarLaptop[] = "00:24:7E:11:22:33";  // out of range
constexpr const char kMouse[] = "00:1F:20:AB:CD:EF";      // paired: its device object exists

// The simulator's control interface.
std::string addAdapter(const std::string& name, const std::string& address);
void removeAdapter(const std::string& name);
void addDevice(const std::string& adapter, const std::string& json);
void setInRange(const std::string& adapter, const std::string& address, bool inRange);
void setPlaying(const std::string& adapter, const std::string& address, bool playing);
void emitSignal(const std::string& path, const std::string& interface, const std::string& member,
                const std::string& signature, const std::string& jsonArgs);
void clearCallLog();

// The default adapter's path, asked of the simulator ("" on failure).
std::string defaultAdapterPath();
// The object path of a device address on the default adapter.
std::string devicePath(const std::string& address);

// Call-log lines that contain text, in order.
std::vector<std::string> logLinesWith(const std::string& text);
// Waits until a call-log line contains text.
bool waitForLogLine(const std::string& text);

// The one receiving thread of this binary, started on first use on a proxy
// that lives until the end (stopLoop ends every loop for good, so it is stopped
// only then). Returns that proxy: the object that argument-less signal handlers
// receive.
Bluetooth::RemoteObject* receivingLoop();
bool receivingLoopRunning();

}  // namespace sim

// Tests against the simulator: started (once) and reset before each test.
class SimTest : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_TRUE(sim::start()); }
};

}  // namespace btbus_test

#endif
