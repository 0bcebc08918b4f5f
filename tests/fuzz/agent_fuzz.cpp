// A peer's request to the pairing agent, answered with no bus to send on.
#include <bluetooth/agent.h>

#include "fuzz.h"

using namespace Bluetooth;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static Agent agent;
    return fuzz::withMessage(data, size, [&](DBusMessage* message) {
        // The settings vary with the input, as a caller may set them.
        agent.setReject(data[size - 1] & 1);
        agent.setPasskeyValue((data[size - 1] & 2) ? "482913" : "not a number");
        DBusHandlerResult result = Agent::handlerDispatcher(0, message, &agent);
        fuzz::require(result == DBUS_HANDLER_RESULT_HANDLED || result == DBUS_HANDLER_RESULT_NOT_YET_HANDLED ||
                          result == DBUS_HANDLER_RESULT_NEED_MEMORY,
                      "one of libdbus's three handler results");
    });
}
