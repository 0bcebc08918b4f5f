// The private mounts that the tests and the demo run in, from a checkout and a
// build tree cloned under /tmp: both stay reachable, nothing else of /tmp does.
#include <dirent.h>
#include <sys/mount.h>
#include <sys/stat.h>

#include <cstdio>
#include <fstream>
#include <set>
#include <string>

#include <gtest/gtest.h>

#include "support/namespace.h"
#include "support/process.h"

namespace {

std::set<std::string> entriesOfTmp() {
    std::set<std::string> names;
    if (DIR* tmp = opendir("/tmp")) {
        while (dirent* entry = readdir(tmp))
            if (entry->d_name[0] != '.') names.insert(entry->d_name);
        closedir(tmp);
    }
    return names;
}

TEST(PrivateMounts, KeepTheTreesUnderTmpTheyRunFrom) {
    BTBUS_IN_PRIVATE_NAMESPACE();
    // In this namespace only: a /tmp that holds a checkout, a build tree and a
    // stray file, beside the trees this test runs from if they lie under /tmp.
    std::string why;
    ASSERT_TRUE(btbus_test::privateTmp({ BTBUS_SOURCE_DIR, BTBUS_TEST_TMP, "/proc/self/exe" }, why)) << why;
    const std::string build = std::string(BTBUS_TEST_TMP) + "/..";
    mkdir("/tmp/checkout", 0755);
    mkdir("/tmp/build", 0755);
    ASSERT_EQ(mount(BTBUS_SOURCE_DIR, "/tmp/checkout", nullptr, MS_BIND, nullptr), 0);
    ASSERT_EQ(mount(build.c_str(), "/tmp/build", nullptr, MS_BIND, nullptr), 0);
    std::ofstream("/tmp/stray") << "";
    const std::string scratch = "/tmp/build/test-tmp/private-mounts";
    mkdir(scratch.c_str(), 0755);

    // The script, as the demo and btbusctl's tests run it from the checkout.
    std::string seen;
    FILE* inside = popen(("cd / && TMPDIR=/tmp/build/test-tmp /tmp/checkout/scripts/in-private-mounts.sh " + scratch +
                          " sh -c 'ls /tmp && test -r /tmp/checkout/README.md && touch /etc/bluetooth/x && echo ok'")
                             .c_str(),
                         "r");
    ASSERT_NE(inside, nullptr);
    char buffer[256];
    while (fgets(buffer, sizeof buffer, inside) != nullptr) seen += buffer;
    EXPECT_EQ(pclose(inside), 0);
    EXPECT_EQ(seen, "build\ncheckout\nok\n");

    // The tests' own helper, kept to what a test runs from.
    ASSERT_TRUE(btbus_test::privateTmp({ "/tmp/checkout/scripts", "/tmp/build/test-tmp" }, why)) << why;
    EXPECT_EQ(entriesOfTmp(), (std::set<std::string>{ "build", "checkout" }));
    EXPECT_TRUE(std::ifstream("/tmp/checkout/README.md").good());
}

}  // namespace
