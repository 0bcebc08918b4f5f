// The agent's settings, its log lines and the handlers' failures on messages
// built in memory (no bus: handlers are given a null connection, so no reply
// leaves). What the dispatcher answers is checked over the bus.
#include <string>
#include <vector>

#include <unistd.h>

#include <gtest/gtest.h>

#include <bluetooth/agent.h>

#include "core/dbus_holders.h"
#include "support/log_capture.h"

namespace {

using Bluetooth::Agent;
using Bluetooth::internal::MessagePtr;
using btbus_test::LogCapture;

TEST(AnAgent, StartsWithItsDefaultAnswersAndNoPath) {
    Agent agent;
    EXPECT_STREQ(agent.getPasskeyValue(), "7391");
    EXPECT_EQ(agent.getPasskeyDelay(), 0);
    EXPECT_FALSE(agent.getReject());
    EXPECT_STREQ(agent.getCapability(), "DisplayYesNo");
    EXPECT_STREQ(agent.getPath(), "");
    EXPECT_STREQ(agent.getInterface(), "org.bluez.Agent");
    EXPECT_STREQ(Agent::PSZ_NO_INPUT_NO_OUTPUT, "NoInputNoOutput");
    EXPECT_STREQ(Agent::PSZ_KEYBOARD_ONLY, "KeyboardOnly");
    EXPECT_STREQ(Agent::PSZ_DISPLAY_ONLY, "DisplayOnly");
}

TEST(AnAgent, RefusesNullSettingsAndANegativeDelayKeepingTheOldValuesAndLogsOnlyThePasskeys) {
    LogCapture log;
    Agent agent;
    EXPECT_EQ(agent.setPasskeyValue("123456"), 0);
    EXPECT_EQ(agent.setPasskeyValue(nullptr), -1);
    EXPECT_STREQ(agent.getPasskeyValue(), "123456");
    EXPECT_EQ(agent.setPasskeyDelay(2), 0);
    EXPECT_EQ(agent.setPasskeyDelay(-1), -1);
    EXPECT_EQ(agent.getPasskeyDelay(), 2);
    EXPECT_EQ(agent.setPasskeyDelay(0), 0);
    EXPECT_EQ(agent.getPasskeyDelay(), 0);
    char capability[] = "KeyboardOnly";
    EXPECT_EQ(agent.setCapability(capability), 0);
    EXPECT_EQ(agent.getCapability(), capability);  // not a copy
    EXPECT_EQ(agent.setCapability(nullptr), -1);
    EXPECT_EQ(agent.getCapability(), capability);
    EXPECT_EQ(agent.setDispatcher(nullptr), -1);
    agent.setReject(true);
    EXPECT_TRUE(agent.getReject());
    EXPECT_EQ(log.lines(), (std::vector<std::string>{
                               "agent.cpp:87 Failed to set null passkey value.",
                               "agent.cpp:106 Failed to set negitive passkey delay." }));
}

TEST(AnAgent, BuildsItsPathFromThePidEvenWhenItCannotRegisterIt) {
    LogCapture log;
    Agent agent;
    EXPECT_EQ(agent.registerPath(), -1);
    EXPECT_EQ(std::string(agent.getPath()), "/org/bluez/agent_" + std::to_string(getpid()));
    EXPECT_EQ(agent.unregisterPath(), -1);
    EXPECT_EQ(log.count("agent.cpp:54 Failed to register agent path to dbus."), 1u);
    EXPECT_EQ(log.count("agent.cpp:65 Failed to unregister agent path from dbus."), 1u);
}

// As it would arrive: with a serial.
MessagePtr call(const char* interface, const char* member) {
    MessagePtr message(dbus_message_new_method_call(":1.1", "/org/bluez/agent_1", interface, member));
    dbus_message_set_serial(message.get(), 7);
    return message;
}

// A request about a device, as bluetoothd sends it.
MessagePtr request(const char* member) {
    MessagePtr message = call("org.bluez.Agent", member);
    const char* device = "/org/bluez/1/hci0/dev_00_11_22_33_44_55";
    dbus_message_append_args(message.get(), DBUS_TYPE_OBJECT_PATH, &device, DBUS_TYPE_INVALID);
    return message;
}

TEST(AnAgentsHandlers, ReportAMessageThatCannotBeAnsweredAsNoReplyMessageAndKeepTheUndispatchedOnesResults) {
    LogCapture log;
    Agent agent;
    MessagePtr unsent(dbus_message_new_method_call(":1.1", "/a", "org.bluez.Agent", "Cancel"));
    EXPECT_EQ(Agent::cancel(nullptr, unsent.get(), &agent), DBUS_HANDLER_RESULT_NEED_MEMORY);
    agent.setReject(true);
    EXPECT_EQ(Agent::requestPasskey(nullptr, unsent.get(), &agent), DBUS_HANDLER_RESULT_NOT_YET_HANDLED);
    MessagePtr passkey = request("RequestPasskey");
    EXPECT_EQ(Agent::requestPasskey(nullptr, passkey.get(), &agent), DBUS_HANDLER_RESULT_HANDLED);
    dbus_message_set_serial(passkey.get(), 0);
    EXPECT_EQ(Agent::requestPasskey(nullptr, passkey.get(), &agent), DBUS_HANDLER_RESULT_NEED_MEMORY);
    agent.setReject(false);
    agent.setPasskeyValue("\xff");  // not UTF-8: cannot be sent as a PIN
    MessagePtr pin = request("RequestPinCode");
    EXPECT_EQ(Agent::requestPinCode(nullptr, pin.get(), &agent), DBUS_HANDLER_RESULT_NEED_MEMORY);
    EXPECT_EQ(log.lines(), (std::vector<std::string>{
                               "agent.cpp:344 Failed to create reply message when handling cancel message.",
                               "agent.cpp:200 Failed to get argument from request passkey message.",
                               "agent.cpp:209 Failed to create reply message when handling request passkey message.",
                               "agent.cpp:173 Failed to create reply message when handling request pin code message." }));
    MessagePtr display = call("org.bluez.Agent", "DisplayPasskey");
    EXPECT_EQ(Agent::displayPasskey(nullptr, display.get(), &agent), DBUS_HANDLER_RESULT_NOT_YET_HANDLED);
    EXPECT_EQ(Agent::confirmModeChange(nullptr, display.get(), &agent), DBUS_HANDLER_RESULT_HANDLED);
    // What the bus cannot send, the dispatcher leaves alone.
    EXPECT_EQ(Agent::handlerDispatcher(nullptr, nullptr, &agent), DBUS_HANDLER_RESULT_NOT_YET_HANDLED);
    EXPECT_EQ(Agent::handlerDispatcher(nullptr, display.get(), nullptr), DBUS_HANDLER_RESULT_NOT_YET_HANDLED);
}

}  // namespace
