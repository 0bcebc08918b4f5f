#include "support/namespace.h"

#include <cstdlib>
#include <iterator>
#include <vector>

#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include "support/process.h"
#include "support/sim.h"

namespace btbus_test {

namespace {

const char kRole[] = "private-namespace";
const char* const kUnshare[] = { "unshare", "-m", "-p", "-f", "--mount-proc" };

std::string currentTest() {
    const ::testing::TestInfo* test = ::testing::UnitTest::GetInstance()->current_test_info();
    return std::string(test->test_suite_name()) + "." + test->name();
}

bool tmpfs(const std::string& directory, std::string& why) {
    if (mount("tmpfs", directory.c_str(), "tmpfs", 0, "size=16m") == 0) return true;
    why = "cannot mount a tmpfs on " + directory;
    return false;
}

}  // namespace

bool inPrivateNamespace(std::string& skip) {
    if (childRole() == kRole) return true;
    std::string probe;
    for (const char* word : kUnshare) probe += std::string(word) + " ";
    if (geteuid() != 0 || std::system((probe + "true >/dev/null 2>&1").c_str()) != 0) {
        skip = "needs root and '" + probe + "' to keep the host's /proc, /tmp, /etc and /usr out of reach";
        return false;
    }
    EXPECT_EQ(runInChild(currentTest(), kRole, std::vector<std::string>(std::begin(kUnshare), std::end(kUnshare))), 0)
        << "the test failed in its private namespace (its output is above)";
    return false;
}

bool overlay(const std::string& directory, std::string& why) {
    std::string base = scratchDir() + "/overlay" + directory;
    for (std::string::size_type at = base.find('/', 1); at != std::string::npos; at = base.find('/', at + 1))
        mkdir(base.substr(0, at).c_str(), 0755);
    mkdir(base.c_str(), 0700);
    // The upper directory must not be on an overlay itself: a tmpfs.
    if (!tmpfs(base, why)) return false;
    mkdir((base + "/upper").c_str(), 0755);
    mkdir((base + "/work").c_str(), 0755);
    std::string options = "lowerdir=" + directory + ",upperdir=" + base + "/upper,workdir=" + base + "/work";
    if (mount("overlay", directory.c_str(), "overlay", 0, options.c_str()) == 0) return true;
    why = "cannot mount an overlay on " + directory;
    return false;
}

bool privateSystemDirectories(std::string& why) {
    if (!tmpfs("/tmp", why) || !overlay("/etc", why) || !overlay("/usr/sbin", why)) return false;
    mkdir("/etc/bluetooth", 0755);
    return tmpfs("/etc/bluetooth", why);
}

}  // namespace btbus_test
