// The tunnel as a configuration section: reading, checking, writing, words.
#include <sstream>

#include <zeparelayd/daemon.h>
#include <zeparelayd/tunnel.h>

#include "support/test_support.h"
#include "tunnel_fixture.h"

using namespace ZEPA::Relay;
using zepatest::ParseJson;
using zepatest::ToJson;

namespace {

const char kModules[] =
    "x_tables.ko ip_tables.ko iptable_filter.ko nf_conntrack.ko nf_defrag_ipv4.ko nf_conntrack_ipv4.ko "
    "nf_nat.ko iptable_nat.ko ipt_REDIRECT.ko xt_multiport.ko xt_tcpudp.ko xt_state.ko ipt_MASQUERADE.ko "
    "tun.ko";

Json::Value FullSection() {
    return ParseJson(R"({"relay_ip":"192.0.2.10","relay_user":"relayuser","relay_pass":"s3cret-pass"})");
}

TEST(TunnelWords, EachStatusHasItsWord) {
    EXPECT_EQ("NONE", Tunnel::GetStatusStr(TUNNEL_STATUS_NONE));
    EXPECT_EQ("READY", Tunnel::GetStatusStr(TUNNEL_STATUS_READY));
    EXPECT_EQ("CLOSE", Tunnel::GetStatusStr(TUNNEL_STATUS_CLOSE));
    EXPECT_EQ("FAILED", Tunnel::GetStatusStr(TUNNEL_STATUS_FAILED));
    EXPECT_EQ("INVALID_CONF", Tunnel::GetStatusStr(TUNNEL_STATUS_INVALID_CONF));
}

TEST(TunnelWords, NumbersAreFixed) {
    EXPECT_EQ(0, TUNNEL_STATUS_NONE);
    EXPECT_EQ(1, TUNNEL_STATUS_READY);
    EXPECT_EQ(2, TUNNEL_STATUS_CLOSE);
    EXPECT_EQ(3, TUNNEL_STATUS_FAILED);
    EXPECT_EQ(4, TUNNEL_STATUS_INVALID_CONF);
    EXPECT_EQ(4u, sizeof(TUNNEL_STATUS));
}

TEST(TunnelWords, OtherValuesAreUnknown) {
    for (int v : {7, 5, -1, 1000})
        EXPECT_EQ("(unknown)", Tunnel::GetStatusStr(static_cast<TUNNEL_STATUS>(v))) << v;
}

TEST(TunnelSection, DefaultsAndModuleList) {
    Tunnel tunnel;
    EXPECT_EQ(-1, tunnel.pid);
    EXPECT_EQ("", tunnel.relay_ip);
    EXPECT_EQ("", tunnel.relay_user);
    EXPECT_EQ("", tunnel.relay_pass);
    EXPECT_EQ(kModules, tunnel.modules);
    EXPECT_EQ(TUNNEL_STATUS_NONE, tunnel.GetStatus());
    EXPECT_EQ("", tunnel.GetHost());
}

TEST(TunnelSection, ReadsTheThreeStrings) {
    Tunnel tunnel(FullSection());
    EXPECT_EQ("192.0.2.10", tunnel.relay_ip);
    EXPECT_EQ("192.0.2.10", tunnel.GetHost());
    EXPECT_EQ("relayuser", tunnel.relay_user);
    EXPECT_EQ("s3cret-pass", tunnel.relay_pass);
    EXPECT_TRUE(tunnel.IsValid());
}

TEST(TunnelSection, NonStringValuesLeaveMembersUnchanged) {
    Tunnel tunnel(FullSection());
    EXPECT_TRUE(tunnel.Overwrite(ParseJson(R"({"relay_ip":5,"relay_user":["x"],"relay_pass":null})")));
    EXPECT_EQ("192.0.2.10", tunnel.relay_ip);
    EXPECT_EQ("relayuser", tunnel.relay_user);
    EXPECT_EQ("s3cret-pass", tunnel.relay_pass);

    Tunnel fresh(ParseJson(R"({"relay_ip":true,"relay_user":{"a":1},"relay_pass":12})"));
    EXPECT_EQ("", fresh.relay_ip);
    EXPECT_EQ("", fresh.relay_user);
    EXPECT_EQ("", fresh.relay_pass);
    EXPECT_FALSE(fresh.IsValid());
}

TEST(TunnelSection, NonObjectIsIgnored) {
    Tunnel tunnel(FullSection());
    for (const char* text : {"[1,2]", "\"relay\"", "null", "3"}) {
        Json::Value value;
        if (std::string(text) != "null") value = ParseJson(std::string("[") + text + "]")[0];
        EXPECT_TRUE(tunnel.Overwrite(value)) << text;
        EXPECT_EQ("192.0.2.10", tunnel.relay_ip) << text;
    }
}

TEST(TunnelSection, PidAndStatusAreNeverRead) {
    Tunnel tunnel(ParseJson(R"({"pid":1,"status":"READY","relay_ip":"h"})"));
    EXPECT_EQ(-1, tunnel.pid);
    EXPECT_EQ(TUNNEL_STATUS_NONE, tunnel.GetStatus());
}

class TunnelValidity : public zepatest::RootTest {};

TEST_F(TunnelValidity, EachFieldIsRequired) {
    for (const char* missing : {"relay_ip", "relay_user", "relay_pass"}) {
        Json::Value section = FullSection();
        section.removeMember(missing);
        Daemon::_logLevel = 7;
        zepatest::StderrCapture capture;
        EXPECT_FALSE(Tunnel(section).IsValid()) << missing;
        EXPECT_TRUE(zepatest::LogContains(capture.stop(), "tunnel:")) << missing;
    }
}

TEST_F(TunnelValidity, InvalidMessageIsDebugLevel) {
    Tunnel tunnel;
    Daemon::_logLevel = 6;
    zepatest::StderrCapture quiet;
    EXPECT_FALSE(tunnel.IsValid());
    EXPECT_EQ("", quiet.stop());

    Daemon::_logLevel = 7;
    zepatest::StderrCapture loud;
    EXPECT_FALSE(tunnel.IsValid());
    const std::vector<std::string> messages = zepatest::LogMessages(loud.stop());
    ASSERT_EQ(1u, messages.size());
    EXPECT_EQ(0u, messages[0].find("tunnel:"));
    EXPECT_NE(std::string::npos, messages[0].find(" invalid tunnel server info"));
}

TEST_F(TunnelValidity, UnsafeUserNamesAreRefused) {
    for (const char* user : {"../../etc/x", "a/b", "/abs", "..", "a..b", "new\nline", "tab\tname"}) {
        Json::Value section = FullSection();
        section["relay_user"] = user;
        zepatest::StderrCapture capture;
        EXPECT_FALSE(Tunnel(section).IsValid()) << user;
        const std::string log = capture.stop();
        EXPECT_TRUE(zepatest::LogContains(log, "unsafe tunnel user name refused")) << user;
    }
}

TEST_F(TunnelValidity, OrdinaryUserNamesAreAccepted) {
    for (const char* user : {"relayuser", "u-1_2.x", "a.b", "user@example", "R3lay"}) {
        Json::Value section = FullSection();
        section["relay_user"] = user;
        EXPECT_TRUE(Tunnel(section).IsValid()) << user;
    }
}

TEST(TunnelWrite, PersistentFormHoldsOnlyTheAddress) {
    Tunnel tunnel(FullSection());
    Json::Value out;
    EXPECT_TRUE(tunnel.Write(out, false));
    EXPECT_EQ(ParseJson(R"({"relay_ip":"192.0.2.10"})"), out);
}

TEST(TunnelWrite, FullFormAddsUserStatusAndPid) {
    Tunnel tunnel(FullSection());
    tunnel.status = TUNNEL_STATUS_FAILED;
    Json::Value out;
    EXPECT_TRUE(tunnel.Write(out, true));
    EXPECT_EQ(ParseJson(R"({"relay_ip":"192.0.2.10","relay_user":"relayuser","status":"FAILED","pid":-1})"),
              out);
    EXPECT_TRUE(out["pid"].isInt());
}

TEST(TunnelWrite, PasswordIsWrittenInNeitherForm) {
    Tunnel tunnel(FullSection());
    for (bool full : {false, true}) {
        Json::Value out;
        tunnel.Write(out, full);
        EXPECT_FALSE(out.isMember("relay_pass")) << full;
        EXPECT_EQ(std::string::npos, ToJson(out).find("s3cret-pass")) << full;
    }
}

TEST(TunnelWrite, UnknownStatusIsWrittenAsItsWord) {
    Tunnel tunnel;
    tunnel.status = static_cast<TUNNEL_STATUS>(7);
    Json::Value out;
    tunnel.Write(out, true);
    EXPECT_EQ("(unknown)", out["status"].asString());
}

TEST(TunnelWrite, PrintedSectionIsTheFullFormWithoutPassword) {
    Tunnel tunnel(FullSection());
    std::ostringstream printed;
    printed << static_cast<const Config&>(tunnel);
    EXPECT_EQ(ParseJson(R"({"relay_ip":"192.0.2.10","relay_user":"relayuser","status":"NONE","pid":-1})"),
              ParseJson(printed.str()));
    EXPECT_EQ(std::string::npos, printed.str().find("s3cret-pass"));
}

TEST(TunnelWrite, WrittenFormReadsBackWithoutTheSecret) {
    Tunnel tunnel(FullSection());
    Json::Value full;
    tunnel.Write(full, true);
    Tunnel back(full);
    EXPECT_EQ(tunnel.relay_ip, back.relay_ip);
    EXPECT_EQ(tunnel.relay_user, back.relay_user);
    // The password has to come from a new server answer.
    EXPECT_EQ("", back.relay_pass);
    EXPECT_FALSE(back.IsValid());

    Json::Value persistent;
    tunnel.Write(persistent, false);
    EXPECT_EQ("192.0.2.10", Tunnel(persistent).GetHost());
}

}  // namespace

namespace {

// Paths below a staging root: each getter names its file under that root.
TEST(TunnelPaths, ResolvedBelowTheRoot) {
    zepatest::TempRoot root;
    EXPECT_EQ(root.path("/usr/sbin/openvpn"), Tunnel::GetProgramPath());
    EXPECT_EQ(root.path("/usr/zepa/etc/zeparelayd/ca/ca.crt"), Tunnel::GetCaCertPath());
    EXPECT_EQ(root.path("/usr/zepa/etc.defaults/zeparelayd/scripts/up.sh"), Tunnel::GetUpScriptPath());
    EXPECT_EQ(root.path("/usr/zepa/etc.defaults/zeparelayd/scripts/down.sh"), Tunnel::GetDownScriptPath());
    EXPECT_EQ(root.path("/usr/zepa/bin/iptablestool"), Tunnel::GetModuleToolPath());
    EXPECT_EQ(root.path("/dev/net/tun"), Tunnel::GetTunDevicePath());
}

}  // namespace
