#include "support/namespace.h"

#include <cstdlib>
#include <iterator>
#include <set>
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

bool privateTmp(const std::vector<std::string>& keep, std::string& why) {
    std::set<std::string> trees;  // the entries of /tmp that hold what is kept
    for (const std::string& path : keep) {
        char* real = realpath(path.c_str(), nullptr);
        std::string found = real != nullptr ? real : "";
        std::free(real);
        if (found.compare(0, 5, "/tmp/") == 0) trees.insert(found.substr(0, found.find('/', 5)));
    }
    // Put together aside, then moved onto /tmp.
    std::string fresh = scratchDir() + "/private-tmp";
    mkdir(fresh.c_str(), 0755);
    if (mount("tmpfs", fresh.c_str(), "tmpfs", 0, "size=16m,mode=1777") != 0) {
        why = "cannot mount a tmpfs on " + fresh;
        return false;
    }
    for (const std::string& tree : trees) {
        std::string at = fresh + tree.substr(4);
        mkdir(at.c_str(), 0755);
        if (mount(tree.c_str(), at.c_str(), nullptr, MS_BIND, nullptr) != 0) {
            why = "cannot bind " + tree + " into the private /tmp";
            return false;
        }
    }
    if (mount(fresh.c_str(), "/tmp", nullptr, MS_MOVE, nullptr) == 0) return true;
    why = "cannot move the private tmpfs onto /tmp";
    return false;
}

bool privateSystemDirectories(std::string& why) {
    // A checkout or a build tree cloned under /tmp stays reachable.
    if (!privateTmp({ BTBUS_SOURCE_DIR, BTBUS_TEST_TMP, "/proc/self/exe" }, why) || !overlay("/etc", why) || !overlay("/usr/sbin", why)) return false;
    mkdir("/etc/bluetooth", 0755);
    return tmpfs("/etc/bluetooth", why);
}

}  // namespace btbus_test
