#ifndef BTBUS_TESTS_SUPPORT_PRIVATE_BUSES_H
#define BTBUS_TESTS_SUPPORT_PRIVATE_BUSES_H

#include <gtest/gtest.h>

namespace btbus_test {

// Two private dbus-daemons, standing in for the system and the session bus,
// started once per test binary before any test and stopped at exit. Their
// addresses are exported as DBUS_SYSTEM_BUS_ADDRESS and DBUS_SESSION_BUS_ADDRESS
// before the library makes its first connection (libdbus keeps the first
// address it sees). Linked into every binary that talks to a bus.
class PrivateBuses : public ::testing::Environment {
public:
    void SetUp() override;
    void TearDown() override;
    // Kills the session bus's daemon (SIGKILL), as a session that ends at once.
    static void killSessionBus();
};

}  // namespace btbus_test

#endif
