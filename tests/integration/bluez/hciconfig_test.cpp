// Adapter::getProperties and /usr/bin/hciconfig. The stand-ins for hciconfig
// are put in place in a private namespace (an overlay on /usr/bin), in a child
// run of this binary, so the host's /usr/bin is never touched.
#include <chrono>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <string>
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
using btbus_test::LogCapture;
namespace sim = btbus_test::sim;

const char kHciconfig[] = "/usr/bin/hciconfig";

void writeStandIn(const std::string& script) {
    unlink(kHciconfig);
    std::ofstream(kHciconfig) << "#!/bin/sh\n" << script;
    chmod(kHciconfig, 0755);
}

// Everything but the last entry, which getProperties may have added.
Dict withoutLast(const Dict& properties) { return Dict(properties.begin(), properties.end() - 1); }

TEST(AnAdaptersProperties, EndWithTheHciVersionThatHciconfigPrints) {
    BTBUS_IN_PRIVATE_NAMESPACE();
    std::string why;
    ASSERT_TRUE(btbus_test::overlay("/usr/bin", why)) << why;
    ASSERT_TRUE(sim::start());
    std::string path = sim::defaultAdapterPath();
    std::unique_ptr<Adapter> adapter(Adapter::getAdapter(path.c_str()));
    ASSERT_NE(adapter, nullptr);
    std::unique_ptr<Dict> plain(adapter->BluezObject::getProperties());
    ASSERT_TRUE(plain != nullptr);
    std::string argsFile = btbus_test::scratchDir() + "/hciconfig-args";

    // A version line among others: its first word, appended last.
    writeStandIn("echo \"$@\" > " + argsFile + "\n"
                 "printf 'hci0:\\tType: Primary  Bus: USB\\n'\n"
                 "printf '\\tBD Address: 00:1A:7D:DA:71:13  ACL MTU: 310:10\\n'\n"
                 "printf '\\tHCI Version: 2.1 (0x4)  Revision: 0x1234\\n'\n"
                 "printf '\\tHCI Version: 4.0 (0x6)  Revision: 0x1\\n'\n");
    {
        LogCapture log;
        std::unique_ptr<Dict> properties(adapter->getProperties());
        ASSERT_TRUE(properties != nullptr);
        ASSERT_EQ(properties->size(), plain->size() + 1);
        EXPECT_EQ(properties->back().first, "HCIVersion");
        EXPECT_EQ(variantToString(properties->back().second), "2.1");
        EXPECT_EQ(properties->back().second.which(), 3);
        EXPECT_EQ(dictToString(withoutLast(*properties)), dictToString(*plain));
        std::ifstream args(argsFile);
        std::string line;
        std::getline(args, line);
        EXPECT_EQ(line, "hci0 -a");
        EXPECT_TRUE(log.lines().empty());
    }
    // One that hangs after its version line is killed after a short grace.
    writeStandIn("printf '\\tHCI Version: 3.0 (0x5)\\n'\nexec sleep 6\n");
    {
        auto start = std::chrono::steady_clock::now();
        std::unique_ptr<Dict> properties(adapter->getProperties());
        EXPECT_LT(std::chrono::steady_clock::now() - start, btbus_test::scaled(std::chrono::seconds(2)));
        ASSERT_TRUE(properties != nullptr);
        EXPECT_EQ(variantToString(properties->back().second), "3.0");
    }
    // No version line: the entry is there, empty.
    writeStandIn("printf 'hci0:\\tType: Primary  Bus: USB\\n\\tHCI Ver: 2.1\\n'\n");
    {
        std::unique_ptr<Dict> properties(adapter->getProperties());
        ASSERT_TRUE(properties != nullptr);
        ASSERT_EQ(properties->size(), plain->size() + 1);
        EXPECT_EQ(properties->back().first, "HCIVersion");
        EXPECT_EQ(variantToString(properties->back().second), "");
    }
    // No hciconfig at all, or one that cannot be run: logged, the entry left out.
    for (bool present : { false, true }) {
        unlink(kHciconfig);
        if (present) std::ofstream(kHciconfig) << "#!/bin/sh\necho '\tHCI Version: 9.9'\n";  // not executable
        LogCapture log;
        std::unique_ptr<Dict> properties(adapter->getProperties());
        ASSERT_TRUE(properties != nullptr);
        EXPECT_EQ(dictToString(*properties), dictToString(*plain));
        EXPECT_EQ(log.lines(), std::vector<std::string>{ "adapter.cpp:438 Failed to get open(/usr/bin/hciconfig hci0)" });
    }
    // A controller name taken from the last path component.
    std::string second = sim::addAdapter("hci1", "00:1A:7D:DA:71:14");
    writeStandIn("echo \"$@\" > " + argsFile + "\n");
    std::unique_ptr<Adapter> other(Adapter::getAdapter(second.c_str()));
    std::unique_ptr<Dict> properties(other->getProperties());
    std::ifstream args(argsFile);
    std::string line;
    std::getline(args, line);
    EXPECT_EQ(line, "hci1 -a");
}

}  // namespace
