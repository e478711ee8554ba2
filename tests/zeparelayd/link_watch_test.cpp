// The route to the relay as a process's network namespace has it: the
// longest prefix wins, a reject route is no way, an unreadable table or a
// host that is no IPv4 address says nothing.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include "link_watch.h"

using zeparelayd::LinkWatch;
using zeparelayd::RouteInTable;
using zeparelayd::RouteState;
using zeparelayd::RouteToHost;

namespace {

const char kHeader[] =
    "Iface\tDestination\tGateway \tFlags\tRefCnt\tUse\tMetric\tMask\t\tMTU\tWindow\tIRTT\n";

// One line as the kernel prints it (addresses as the words in memory, which
// on this little-endian machine reads byte-reversed).
std::string Line(const char* iface, const char* dest, const char* flags, const char* metric,
                 const char* mask) {
    return std::string(iface) + "\t" + dest + "\t00000000\t" + flags + "\t0\t0\t" + metric + "\t" + mask +
           "\t0\t0\t0\n";
}

bool LittleEndian() {
    const uint16_t one = 1;
    return *reinterpret_cast<const unsigned char*>(&one) == 1;
}

TEST(LinkWatch, OnLinkRouteIsAWayAndItsLossIsNone) {
    if (!LittleEndian()) GTEST_SKIP() << "the sample tables are written for a little-endian machine";
    // wan0 10.213.0.2/30: 10.213.0.0 -> 0000D50A, /30 -> FCFFFFFF.
    const std::string up = std::string(kHeader) + Line("wan0", "0000D50A", "0001", "0", "FCFFFFFF");
    EXPECT_EQ(RouteState::ROUTE, RouteInTable(up, "10.213.0.1"));
    EXPECT_EQ(RouteState::NO_ROUTE, RouteInTable(up, "10.213.0.5"));
    EXPECT_EQ(RouteState::NO_ROUTE, RouteInTable(kHeader, "10.213.0.1")) << "link down: the table is empty";
}

TEST(LinkWatch, DefaultRouteCoversEveryHostAndTheLongestPrefixWins) {
    if (!LittleEndian()) GTEST_SKIP() << "the sample tables are written for a little-endian machine";
    std::string table = std::string(kHeader) + Line("eth0", "00000000", "0003", "0", "00000000");
    EXPECT_EQ(RouteState::ROUTE, RouteInTable(table, "10.213.0.1"));
    EXPECT_EQ(RouteState::ROUTE, RouteInTable(table, "192.0.2.7"));
    // A blackhole for 10.213.0.0/24 beats the default for that net only.
    table += Line("*", "0000D50A", "0201", "0", "00FFFFFF");
    EXPECT_EQ(RouteState::NO_ROUTE, RouteInTable(table, "10.213.0.1"));
    EXPECT_EQ(RouteState::ROUTE, RouteInTable(table, "192.0.2.7"));
    // A /30 on a link beats the blackhole /24.
    table += Line("wan0", "0000D50A", "0001", "0", "FCFFFFFF");
    EXPECT_EQ(RouteState::ROUTE, RouteInTable(table, "10.213.0.1"));
    // Same prefix: the lower metric counts; a route that is not up is no candidate.
    const std::string twice = std::string(kHeader) + Line("wan0", "0000D50A", "0201", "5", "FCFFFFFF") +
                              Line("wan1", "0000D50A", "0001", "10", "FCFFFFFF");
    EXPECT_EQ(RouteState::NO_ROUTE, RouteInTable(twice, "10.213.0.1"));
    const std::string notUp = std::string(kHeader) + Line("wan0", "0000D50A", "0200", "5", "FCFFFFFF") +
                              Line("wan1", "0000D50A", "0001", "10", "FCFFFFFF");
    EXPECT_EQ(RouteState::ROUTE, RouteInTable(notUp, "10.213.0.1"));
}

TEST(LinkWatch, WhatCannotBeReadSaysNothing) {
    EXPECT_EQ(RouteState::UNKNOWN, RouteInTable("", "10.213.0.1"));
    EXPECT_EQ(RouteState::UNKNOWN, RouteInTable("garbage\n", "10.213.0.1"));
    EXPECT_EQ(RouteState::UNKNOWN, RouteInTable(kHeader, "relay.example"));
    EXPECT_EQ(RouteState::UNKNOWN, RouteInTable(kHeader, "2001:db8::1"));
    // Broken lines are skipped, not taken as routes.
    EXPECT_EQ(RouteState::NO_ROUTE, RouteInTable(std::string(kHeader) + "wan0 zz 0 1\n", "10.213.0.1"));
    EXPECT_EQ(RouteState::UNKNOWN, RouteToHost(-1, "10.213.0.1"));
    EXPECT_EQ(RouteState::UNKNOWN, RouteToHost(getpid(), "not-an-address"));
    // A process that is gone has no table.
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) _exit(0);
    ASSERT_EQ(child, waitpid(child, nullptr, 0));
    EXPECT_EQ(RouteState::UNKNOWN, RouteToHost(child, "10.213.0.1"));
    // A live process's own table is read (whether it routes there or not).
    EXPECT_NE(RouteState::UNKNOWN, RouteToHost(getpid(), "192.0.2.7"));
}

// Our own namespace: the route to an outside address (a documentation one,
// never contacted) and its device, asked through netlink.
TEST(LinkWatch, WatchesTheRouteAndItsDeviceInOurNamespace) {
    std::string device;
    if (RouteToHost(getpid(), "192.0.2.7", &device) != RouteState::ROUTE) {
        GTEST_SKIP() << "this machine has no route to outside addresses";
    }
    EXPECT_FALSE(device.empty());
    LinkWatch watch;
    EXPECT_EQ(LinkWatch::UNKNOWN, watch.Check());
    ASSERT_TRUE(watch.Start(getpid(), "192.0.2.7"));
    EXPECT_TRUE(watch.Watching());
    // The device that carries our default route is up with carrier.
    EXPECT_EQ(LinkWatch::UP, watch.Check()) << device;
    EXPECT_EQ(LinkWatch::UP, watch.Check()) << "asked again: " << device;
    watch.Stop();
    EXPECT_FALSE(watch.Watching());
    EXPECT_EQ(LinkWatch::UNKNOWN, watch.Check());
    // Nothing to watch where there is no route now, nor for a process that is gone.
    EXPECT_FALSE(watch.Start(getpid(), "not-an-address"));
    EXPECT_FALSE(watch.Start(-1, "192.0.2.7"));
}

}  // namespace
