// The network section over the real SDK, in a private network namespace.
#include <gtest/gtest.h>

#include <zeparelayd/config.h>

#include "netns_fixture.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;

namespace {
class NetworkStateTest : public PrivateNetTest {};
}  // namespace

TEST_F(NetworkStateTest, ReadsUpInterfacesAndGateway) {
    if (!Cable()) GTEST_SKIP() << "cannot create veth interfaces";
    ASSERT_TRUE(Shell("ip route add default via 10.9.8.1"));
    NetworkConf conf(true);
    ASSERT_EQ(1u, conf.interfaces.size());
    EXPECT_EQ(InterfaceConf("zn0", "10.9.8.7", "255.255.255.0"), conf.interfaces.front());
    EXPECT_EQ("10.9.8.1", conf.gateway);
    EXPECT_EQ("", conf.ddns);
}

TEST_F(NetworkStateTest, NothingUpGivesEmptyState) {
    NetworkConf conf(true);
    EXPECT_TRUE(conf.interfaces.empty());
    EXPECT_EQ("", conf.gateway);
    Json::Value out;
    conf.Write(out, true);
    EXPECT_EQ(0u, out["interface"].size());
    EXPECT_EQ(0u, out["ipv6_tunnel"].size());
}

TEST_F(NetworkStateTest, InterfaceOfAnotherMachineIsDropped) {
    if (!Cable()) GTEST_SKIP() << "cannot create veth interfaces";
    NetworkConf conf(false);
    conf.Overwrite(zepatest::ParseJson(
        "{\"interface\":[{\"name\":\"zn0\",\"ip\":\"10.9.8.7\",\"mask\":\"255.255.255.0\"},"
        "{\"name\":\"eth7\",\"ip\":\"10.9.9.7\",\"mask\":\"255.255.255.0\"}]}"));
    ASSERT_EQ(1u, conf.interfaces.size());
    EXPECT_EQ("zn0", conf.interfaces.front().name);
}

TEST_F(NetworkStateTest, TunnelAddressesAreWritten) {
    if (!Shell("ip tuntap add tun mode tun")) GTEST_SKIP() << "cannot create a tun device";
    if (!Shell("ip -6 addr add fe80::5/64 dev tun")) GTEST_SKIP() << "IPv6 is off here";
    NetworkConf conf(false);
    Json::Value out;
    conf.Write(out, true);
    ASSERT_EQ(1u, out["ipv6_tunnel"].size());
    EXPECT_EQ("fe80::5", out["ipv6_tunnel"][0]["address"].asString());
    EXPECT_EQ("link", out["ipv6_tunnel"][0]["scope"].asString());
    EXPECT_EQ(64u, out["ipv6_tunnel"][0]["prefix_length"].asUInt());
}
