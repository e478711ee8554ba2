// A private network namespace per test, so a test can dictate interfaces,
// addresses and routes for real.
#ifndef ZEPARELAYD_TESTS_SDK_NET_NETNS_FIXTURE_H
#define ZEPARELAYD_TESTS_SDK_NET_NETNS_FIXTURE_H

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>

#include "support/test_support.h"

inline bool Shell(const std::string& cmd) { return system((cmd + " >/dev/null 2>&1").c_str()) == 0; }

// A private network namespace for one test, left again at its end; skipped
// where the machine does not permit one.
class PrivateNetTest : public zepatest::RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        _home = open("/proc/self/ns/net", O_RDONLY | O_CLOEXEC);
        if (_home < 0 || unshare(CLONE_NEWNET) != 0)
            GTEST_SKIP() << "no private network namespace here: " << strerror(errno);
        _inside = true;
        if (!Shell("ip link set lo up")) GTEST_SKIP() << "the ip tool is missing";
    }
    void TearDown() override {
        if (_inside && setns(_home, CLONE_NEWNET) != 0) ADD_FAILURE() << "cannot leave the namespace";
        if (_home >= 0) close(_home);
        RootTest::TearDown();
    }
    // Two ends of a virtual Ethernet cable, zn0 up with 10.9.8.7/24; false
    // when the machine cannot make one.
    bool Cable() {
        if (!Shell("ip link add zn0 type veth peer name zn1")) return false;
        EXPECT_TRUE(Shell("ip addr add 10.9.8.7/24 dev zn0 && ip link set zn0 up"));
        return true;
    }
    int _home = -1;
    bool _inside = false;
};

#endif
