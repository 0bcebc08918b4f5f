// The agent's settings and the handlers' failures on messages built in memory, given no connection
// (so no reply leaves). What the dispatcher answers, by default and as set, is checked over the bus.
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

TEST(AnAgent, NamesTheCapabilitiesAsBluezDoesAndTakesItsPathFromThePidEvenWhenItCannotRegisterIt) {
    Agent agent;
    EXPECT_STREQ(Agent::PSZ_NO_INPUT_NO_OUTPUT, "NoInputNoOutput");
    EXPECT_STREQ(Agent::PSZ_DISPLAY_ONLY, "DisplayOnly");
    EXPECT_EQ(agent.registerPath(), -1);
    EXPECT_EQ(agent.getPath(), "/org/bluez/agent_" + std::to_string(getpid()));
}

TEST(AnAgent, RefusesNullSettingsAndANegativeDelayKeepingTheOldValuesAndLogsOnlyThePasskeys) {
    LogCapture log;
    Agent agent;
    EXPECT_EQ(agent.setPasskeyValue(nullptr), -1);
    EXPECT_STREQ(agent.getPasskeyValue(), "7391");
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
    EXPECT_EQ(log.lines(), (std::vector<std::string>{
                               "agent.cpp:87 Failed to set null passkey value.",
                               "agent.cpp:106 Failed to set negitive passkey delay." }));
}

// A request about a device, as bluetoothd sends it; with serial 0 no reply can be made to it.
MessagePtr request(const char* member, dbus_uint32_t serial) {
    MessagePtr message(dbus_message_new_method_call(":1.1", "/org/bluez/agent_1", "org.bluez.Agent", member));
    const char* device = "/org/bluez/1/hci0/dev_00_11_22_33_44_55";
    dbus_message_append_args(message.get(), DBUS_TYPE_OBJECT_PATH, &device, DBUS_TYPE_INVALID);
    dbus_message_set_serial(message.get(), serial);
    return message;
}

TEST(AnAgentsHandlers, ReportAMessageThatCannotBeAnsweredAsNoReplyMessageAndKeepTheUndispatchedOnesResults) {
    Agent agent;
    agent.setPasskeyValue("\xff");  // not UTF-8: cannot be sent as a PIN
    agent.setReject(true);           // nor can a passkey's refusal; a PIN request and Cancel ignore it
    const struct {
        DBusHandlerResult (*handler)(DBusConnection*, DBusMessage*, Agent*);
        MessagePtr message;
        DBusHandlerResult result;
        std::vector<std::string> log;
    } cases[] = {
        { &Agent::cancel, request("Cancel", 0), DBUS_HANDLER_RESULT_NEED_MEMORY,
          { "agent.cpp:344 Failed to create reply message when handling cancel message." } },
        { &Agent::requestPasskey, request("RequestPasskey", 0), DBUS_HANDLER_RESULT_NEED_MEMORY,
          { "agent.cpp:209 Failed to create reply message when handling request passkey message." } },
        { &Agent::requestPinCode, request("RequestPinCode", 7), DBUS_HANDLER_RESULT_NEED_MEMORY,
          { "agent.cpp:173 Failed to create reply message when handling request pin code message." } },
        { &Agent::displayPasskey, request("DisplayPasskey", 7), DBUS_HANDLER_RESULT_NOT_YET_HANDLED, {} },
        { &Agent::confirmModeChange, request("ConfirmModeChange", 7), DBUS_HANDLER_RESULT_HANDLED, {} },
    };
    for (const auto& c : cases) {
        LogCapture log;
        EXPECT_EQ(c.handler(nullptr, c.message.get(), &agent), c.result) << dbus_message_get_member(c.message.get());
        EXPECT_EQ(log.lines(), c.log);
    }
    // What the bus cannot send, the dispatcher leaves alone.
    EXPECT_EQ(Agent::handlerDispatcher(nullptr, nullptr, &agent), DBUS_HANDLER_RESULT_NOT_YET_HANDLED);
    EXPECT_EQ(Agent::handlerDispatcher(nullptr, cases[0].message.get(), nullptr), DBUS_HANDLER_RESULT_NOT_YET_HANDLED);
}

}  // namespace
