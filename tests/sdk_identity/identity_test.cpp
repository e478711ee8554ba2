#include <dirent.h>
#include <gtest/gtest.h>
#include <net/if.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <sched.h>
#include <sys/stat.h>
#include <unistd.h>
#include <zepasdk/identity.h>

#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>

#include "support/test_support.h"

namespace {

class HubtokenTest : public zepatest::RootTest {};
class ApiKeyTest : public zepatest::RootTest {};
class MacAddressTest : public zepatest::RootTest {};

bool IsHex(const std::string& s) { return s.find_first_not_of("0123456789abcdef") == std::string::npos; }

std::string Trim(const std::string& s) {
    size_t end = s.find_last_not_of(" \r\n");
    return end == std::string::npos ? std::string() : s.substr(0, end + 1);
}

std::string ExpectedToken(const std::string& secret, const std::string& serial) {
    unsigned char mac[EVP_MAX_MD_SIZE];
    unsigned int len = 0;
    HMAC(EVP_sha256(), secret.data(), static_cast<int>(secret.size()),
         reinterpret_cast<const unsigned char*>(serial.data()), serial.size(), mac, &len);
    std::string hex;
    char two[3];
    for (unsigned int i = 0; i < 16; ++i) {
        snprintf(two, sizeof(two), "%02x", mac[i]);
        hex += two;
    }
    return hex;
}

std::string Generate(const char* serial) {
    char token[ZEPA_HUBTOKEN_TOKEN_SIZE];
    memset(token, 'x', sizeof(token));
    EXPECT_EQ(0, ZEPAHubtokenGenerateToken(serial, token, sizeof(token)));
    return token;
}

}  // namespace

TEST_F(HubtokenTest, GetTokenReadsSerialAndToken) {
    root.write("/etc/zepa/hubtoken.conf",
               "serial=\"2150ABN123456\"\ntoken=\"0123456789abcdef0123456789abcdef\"\n");
    char serial[36], token[33];
    EXPECT_EQ(0, ZEPAHubtokenGetToken(serial, sizeof(serial), token, sizeof(token)));
    EXPECT_STREQ("2150ABN123456", serial);
    EXPECT_STREQ("0123456789abcdef0123456789abcdef", token);
    EXPECT_EQ(ZEPA_ERR_NONE, VLIBCErrGet());
}

TEST_F(HubtokenTest, GetTokenWithoutFileFails) {
    char serial[36] = "s", token[33] = "t";
    EXPECT_EQ(-1, ZEPAHubtokenGetToken(serial, sizeof(serial), token, sizeof(token)));
    EXPECT_EQ(ZEPA_ERR_FILE_NOT_FOUND, VLIBCErrGet());
    EXPECT_STREQ("", serial);
    EXPECT_STREQ("", token);
}

TEST_F(HubtokenTest, GetTokenNeedsBothKeys) {
    char serial[36], token[33];
    root.write("/etc/zepa/hubtoken.conf", "serial=\"S1\"\n");
    EXPECT_EQ(-1, ZEPAHubtokenGetToken(serial, sizeof(serial), token, sizeof(token)));
    EXPECT_EQ(ZEPA_ERR_KEY_NOT_FOUND, VLIBCErrGet());
    root.write("/etc/zepa/hubtoken.conf", "token=\"T1\"\nserial=\"\"\n");
    EXPECT_EQ(-1, ZEPAHubtokenGetToken(serial, sizeof(serial), token, sizeof(token)));
    EXPECT_EQ(ZEPA_ERR_KEY_NOT_FOUND, VLIBCErrGet());
    EXPECT_STREQ("", serial);
    EXPECT_STREQ("", token);
}

TEST_F(HubtokenTest, GetTokenRefusesValuesThatDoNotFit) {
    char serial[36], token[33];
    std::string s35(35, 'S'), s36(36, 'S');
    root.write("/etc/zepa/hubtoken.conf", "serial=\"" + s35 + "\"\ntoken=\"" + std::string(32, 'a') + "\"\n");
    EXPECT_EQ(0, ZEPAHubtokenGetToken(serial, sizeof(serial), token, sizeof(token)));
    EXPECT_EQ(s35, serial);
    root.write("/etc/zepa/hubtoken.conf", "serial=\"" + s36 + "\"\ntoken=\"t\"\n");
    EXPECT_EQ(-1, ZEPAHubtokenGetToken(serial, sizeof(serial), token, sizeof(token)));
    EXPECT_EQ(ZEPA_ERR_BUFFER_TOO_SMALL, VLIBCErrGet());
    EXPECT_STREQ("", serial);
    root.write("/etc/zepa/hubtoken.conf", "serial=\"s\"\ntoken=\"" + std::string(33, 'a') + "\"\n");
    EXPECT_EQ(-1, ZEPAHubtokenGetToken(serial, sizeof(serial), token, sizeof(token)));
    EXPECT_EQ(ZEPA_ERR_BUFFER_TOO_SMALL, VLIBCErrGet());
    EXPECT_STREQ("", token);
}

TEST_F(HubtokenTest, GetTokenBadArguments) {
    char serial[36], token[33];
    EXPECT_EQ(-1, ZEPAHubtokenGetToken(nullptr, 36, token, sizeof(token)));
    EXPECT_EQ(ZEPA_ERR_BAD_PARAMETERS, VLIBCErrGet());
    EXPECT_EQ(-1, ZEPAHubtokenGetToken(serial, 0, token, sizeof(token)));
    EXPECT_EQ(-1, ZEPAHubtokenGetToken(serial, sizeof(serial), nullptr, 33));
}

TEST_F(HubtokenTest, GeneratedTokenIsKeyedHashOfSerial) {
    std::string token = Generate("ABC123");
    EXPECT_EQ(32u, token.size());
    EXPECT_TRUE(IsHex(token)) << token;
    ASSERT_TRUE(root.exists("/etc/zepa/hubtoken.secret"));
    std::string secret = Trim(root.read("/etc/zepa/hubtoken.secret"));
    EXPECT_EQ(64u, secret.size());
    EXPECT_EQ(ExpectedToken(secret, "ABC123"), token);
    EXPECT_EQ(0600u, zepatest::FileMode(root.path("/etc/zepa/hubtoken.secret")) & 0777);
}

TEST_F(HubtokenTest, GeneratedTokenIsStablePerSerial) {
    std::string a = Generate("ABC123");
    EXPECT_EQ(a, Generate("ABC123"));
    EXPECT_NE(a, Generate("ABC124"));
}

TEST_F(HubtokenTest, GivenSecretKeysTheToken) {
    root.write("/etc/zepa/hubtoken.secret", "device-secret-one\n", 0600);
    std::string one = Generate("ABC123");
    EXPECT_EQ(ExpectedToken("device-secret-one", "ABC123"), one);
    root.write("/etc/zepa/hubtoken.secret", "device-secret-two\n", 0600);
    EXPECT_NE(one, Generate("ABC123"));
}

TEST_F(HubtokenTest, TwoDevicesDeriveDifferentTokens) {
    std::string first = Generate("ABC123");
    zepatest::TempRoot second;
    EXPECT_NE(first, Generate("ABC123"));
}

TEST_F(HubtokenTest, GenerateRefusesBadArguments) {
    char token[33] = "unchanged";
    EXPECT_EQ(-1, ZEPAHubtokenGenerateToken("", token, sizeof(token)));
    EXPECT_EQ(ZEPA_ERR_BAD_PARAMETERS, VLIBCErrGet());
    EXPECT_STREQ("", token);
    EXPECT_EQ(-1, ZEPAHubtokenGenerateToken(nullptr, token, sizeof(token)));
    EXPECT_EQ(-1, ZEPAHubtokenGenerateToken("S", token, 32));
    EXPECT_EQ(ZEPA_ERR_BUFFER_TOO_SMALL, VLIBCErrGet());
    EXPECT_FALSE(root.exists("/etc/zepa/hubtoken.secret"));
}

TEST_F(HubtokenTest, GenerateFailsWithoutUsableSecret) {
    root.mkdir("/etc/zepa/hubtoken.secret");
    char token[33];
    EXPECT_EQ(-1, ZEPAHubtokenGenerateToken("S", token, sizeof(token)));
    EXPECT_EQ(ZEPA_ERR_IO, VLIBCErrGet());
    EXPECT_STREQ("", token);
}

TEST_F(HubtokenTest, EmptySecretIsNotReplaced) {
    root.write("/etc/zepa/hubtoken.secret", "", 0600);
    char token[33];
    EXPECT_EQ(-1, ZEPAHubtokenGenerateToken("S", token, sizeof(token)));
    EXPECT_EQ(ZEPA_ERR_IO, VLIBCErrGet());
    EXPECT_EQ("", root.read("/etc/zepa/hubtoken.secret"));
}

TEST_F(HubtokenTest, CreationLeavesNoTemporaryFile) {
    Generate("S");
    std::string listing;
    DIR* dir = opendir(root.path("/etc/zepa").c_str());
    ASSERT_NE(nullptr, dir);
    while (struct dirent* e = readdir(dir))
        if (e->d_name[0] != '.') listing += std::string(e->d_name) + " ";
    closedir(dir);
    EXPECT_EQ("hubtoken.secret ", listing);
}

TEST_F(ApiKeyTest, RegisterStoresFreshKey) {
    char key[ZEPA_CLOUD_KEY_SIZE];
    EXPECT_EQ(64, ZEPACloudServiceRegisterApiKey(key, sizeof(key)));
    EXPECT_TRUE(IsHex(key)) << key;
    EXPECT_EQ(std::string("api_key=\"") + key + "\"\n", root.read("/etc/zepa/cloudservice.conf"));
    std::string first = key;
    EXPECT_EQ(64, ZEPACloudServiceRegisterApiKey(key, sizeof(key)));
    EXPECT_NE(first, key);
}

TEST_F(ApiKeyTest, RegisterKeepsOtherLines) {
    root.write("/etc/zepa/cloudservice.conf", "# cloud\nregion=\"eu\"\napi_key=\"old\"\n");
    char key[ZEPA_CLOUD_KEY_SIZE];
    ASSERT_EQ(64, ZEPACloudServiceRegisterApiKey(key, sizeof(key)));
    std::string text = root.read("/etc/zepa/cloudservice.conf");
    EXPECT_NE(std::string::npos, text.find("region=\"eu\""));
    EXPECT_NE(std::string::npos, text.find(key));
    EXPECT_EQ(std::string::npos, text.find("\"old\""));
}

TEST_F(ApiKeyTest, RegisterWithSmallBufferStoresNothing) {
    char key[64];
    EXPECT_EQ(-1, ZEPACloudServiceRegisterApiKey(key, sizeof(key)));
    EXPECT_EQ(ZEPA_ERR_BUFFER_TOO_SMALL, VLIBCErrGet());
    EXPECT_FALSE(root.exists("/etc/zepa/cloudservice.conf"));
    EXPECT_EQ(-1, ZEPACloudServiceRegisterApiKey(nullptr, 1024));
    EXPECT_EQ(ZEPA_ERR_BAD_PARAMETERS, VLIBCErrGet());
}

TEST_F(ApiKeyTest, RegisterFailsWhenFileCannotBeWritten) {
    root.write("/etc/zepa", "a file, not a folder");
    char key[ZEPA_CLOUD_KEY_SIZE];
    EXPECT_EQ(-1, ZEPACloudServiceRegisterApiKey(key, sizeof(key)));
    EXPECT_EQ(ZEPA_ERR_IO, VLIBCErrGet());
    EXPECT_STREQ("", key);
}

TEST_F(ApiKeyTest, GetReadsStoredKey) {
    root.write("/etc/zepa/cloudservice.conf", "api_key=\"stored-key\"\n");
    char key[ZEPA_CLOUD_KEY_SIZE];
    EXPECT_EQ(10, ZEPACloudServiceGetApiKey(key, 0));
    EXPECT_STREQ("stored-key", key);
    EXPECT_EQ(10, ZEPACloudServiceGetApiKey(key, ZEPA_CLOUD_KEY_REGISTER));
    EXPECT_STREQ("stored-key", key);
}

TEST_F(ApiKeyTest, GetWithoutKeyFailsUnlessAskedToRegister) {
    char key[ZEPA_CLOUD_KEY_SIZE] = "x";
    EXPECT_EQ(-1, ZEPACloudServiceGetApiKey(key, 0));
    EXPECT_EQ(ZEPA_ERR_FILE_NOT_FOUND, VLIBCErrGet());
    EXPECT_STREQ("", key);
    root.write("/etc/zepa/cloudservice.conf", "region=\"eu\"\n");
    EXPECT_EQ(-1, ZEPACloudServiceGetApiKey(key, 0));
    EXPECT_EQ(ZEPA_ERR_KEY_NOT_FOUND, VLIBCErrGet());
    EXPECT_EQ(64, ZEPACloudServiceGetApiKey(key, ZEPA_CLOUD_KEY_REGISTER));
    char again[ZEPA_CLOUD_KEY_SIZE];
    EXPECT_EQ(64, ZEPACloudServiceGetApiKey(again, 0));
    EXPECT_STREQ(key, again);
    EXPECT_EQ(-1, ZEPACloudServiceGetApiKey(nullptr, 0));
}

namespace {

std::string SysText(const std::string& path) {
    std::ifstream in(path);
    std::string line;
    std::getline(in, line);
    return line;
}

// The first wired interface as /sys describes the live namespace.
std::string SysFirstWiredMac() {
    std::string best;
    long bestIndex = LONG_MAX;
    DIR* dir = opendir("/sys/class/net");
    if (dir == nullptr) return best;
    while (struct dirent* e = readdir(dir)) {
        std::string name = e->d_name;
        if (name[0] == '.') continue;
        std::string base = "/sys/class/net/" + name;
        std::string address = SysText(base + "/address");
        if (SysText(base + "/type") != "1" || address.size() != 17 || address == "00:00:00:00:00:00")
            continue;
        if (zepatest::FileExists(base + "/wireless") || zepatest::FileExists(base + "/phy80211")) continue;
        long index = atol(SysText(base + "/ifindex").c_str());
        if (index < bestIndex) {
            bestIndex = index;
            best = address;
        }
    }
    closedir(dir);
    return best;
}

bool Shell(const std::string& cmd) { return system((cmd + " >/dev/null 2>&1").c_str()) == 0; }

}  // namespace

TEST_F(MacAddressTest, LiveMachineAgreesWithSys) {
    std::string expected = SysFirstWiredMac();
    char mac[ZEPA_CLOUD_MAC_SIZE];
    int rc = ZEPACloudServiceGetMacAddress(mac, sizeof(mac));
    if (expected.empty()) {
        EXPECT_EQ(-1, rc);
        EXPECT_EQ(ZEPA_ERR_NOT_FOUND, VLIBCErrGet());
    } else {
        EXPECT_EQ(0, rc);
        EXPECT_EQ(expected, mac);
    }
}

TEST_F(MacAddressTest, SmallBufferIsRefused) {
    char mac[17] = "x";
    EXPECT_EQ(-1, ZEPACloudServiceGetMacAddress(mac, sizeof(mac)));
    EXPECT_EQ(ZEPA_ERR_BUFFER_TOO_SMALL, VLIBCErrGet());
    EXPECT_STREQ("", mac);
    EXPECT_EQ(-1, ZEPACloudServiceGetMacAddress(nullptr, 18));
    EXPECT_EQ(ZEPA_ERR_BAD_PARAMETERS, VLIBCErrGet());
}

TEST_F(MacAddressTest, PrivateNamespaceDecidesTheAddress) {
    if (unshare(CLONE_NEWNET) != 0) GTEST_SKIP() << "no private network namespace here: " << strerror(errno);
    char mac[ZEPA_CLOUD_MAC_SIZE];
    // Only the loopback: no wired interface.
    EXPECT_EQ(-1, ZEPACloudServiceGetMacAddress(mac, sizeof(mac)));
    EXPECT_EQ(ZEPA_ERR_NOT_FOUND, VLIBCErrGet());
    if (!Shell("ip link add zt1 type veth peer name zt0")) GTEST_SKIP() << "cannot create veth interfaces";
    ASSERT_TRUE(Shell("ip link set zt1 address 02:aa:00:00:00:01"));
    ASSERT_TRUE(Shell("ip link set zt0 address 02:aa:00:00:00:00"));
    unsigned first = if_nametoindex("zt1") < if_nametoindex("zt0") ? 1 : 0;
    EXPECT_EQ(0, ZEPACloudServiceGetMacAddress(mac, sizeof(mac)));
    EXPECT_EQ("02:aa:00:00:00:0" + std::to_string(first), std::string(mac));
    // Down interfaces count too; a deleted one does not.
    ASSERT_TRUE(Shell(first == 1 ? "ip link del zt1" : "ip link del zt0"));
    EXPECT_EQ(-1, ZEPACloudServiceGetMacAddress(mac, sizeof(mac)));
}
