// The local test server itself: start and clean stop, scripted answers,
// request records, route modules, HTTPS with the throwaway CA.
#include <arpa/inet.h>
#include <curl/curl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <ctime>
#include <string>

#include "support/local_server.h"
#include "support/test_support.h"

using zepatest::LocalServer;
using zepatest::RecordedBody;
using zepatest::RecordedHeader;

namespace {

struct Answer {
    CURLcode code = CURLE_OK;
    long status = 0;
    std::string body;
    std::string headers;
};

size_t Append(char* ptr, size_t size, size_t count, void* userdata) {
    static_cast<std::string*>(userdata)->append(ptr, size * count);
    return size * count;
}

Answer Fetch(const std::string& url, const char* post = nullptr, const std::string& caFile = "") {
    Answer a;
    CURL* curl = curl_easy_init();
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, Append);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &a.body);
    curl_easy_setopt(curl, CURLOPT_HEADERFUNCTION, Append);
    curl_easy_setopt(curl, CURLOPT_HEADERDATA, &a.headers);
    curl_easy_setopt(curl, CURLOPT_TIMEOUT, 8L);
    if (post != nullptr) curl_easy_setopt(curl, CURLOPT_POSTFIELDS, post);
    if (!caFile.empty()) curl_easy_setopt(curl, CURLOPT_CAINFO, caFile.c_str());
    a.code = curl_easy_perform(curl);
    curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &a.status);
    curl_easy_cleanup(curl);
    return a;
}

bool Accepts(int port) {
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    struct sockaddr_in addr = {};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    addr.sin_port = htons(static_cast<uint16_t>(port));
    bool ok = connect(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) == 0;
    close(fd);
    return ok;
}

}  // namespace

class LocalServerTest : public zepatest::RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        ASSERT_TRUE(server.ok()) << server.error();
    }
    LocalServer server;
};

TEST_F(LocalServerTest, StartsOnTwoPortsAndStopsCleanlyOnSigterm) {
    EXPECT_GT(server.httpPort(), 0);
    EXPECT_GT(server.httpsPort(), 0);
    EXPECT_NE(server.httpPort(), server.httpsPort());
    EXPECT_TRUE(zepatest::FileExists(server.caFile()));
    EXPECT_EQ(0u, server.caFile().find(server.certDir()));
    EXPECT_EQ(200, Fetch(server.httpUrl("/_control/ping")).status);
    const int port = server.httpPort();
    int status = server.stop();
    ASSERT_TRUE(WIFEXITED(status)) << status;
    EXPECT_EQ(0, WEXITSTATUS(status));
    EXPECT_FALSE(Accepts(port));
}

TEST_F(LocalServerTest, StopsCleanlyWhileARequestHangs) {
    ASSERT_TRUE(server.hang("/test/json", 30));
    CURLM* multi = curl_multi_init();
    CURL* curl = curl_easy_init();
    std::string url = server.httpUrl("/test/json");
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_multi_add_handle(multi, curl);
    int running = 0;
    for (int i = 0; i < 1000 && server.requests("/test/json").size() == 0; ++i) {
        curl_multi_perform(multi, &running);
        curl_multi_wait(multi, nullptr, 0, 10, nullptr);
    }
    ASSERT_EQ(1u, server.requests("/test/json").size());
    int status = server.stop();
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    curl_multi_remove_handle(multi, curl);
    curl_easy_cleanup(curl);
    curl_multi_cleanup(multi);
}

TEST_F(LocalServerTest, ScriptAnswersTheNextCountRequestsOfItsPath) {
    ASSERT_TRUE(server.script("/test/json", 503, "busy", 2, {{"X-Test", "yes"}}));
    Answer first = Fetch(server.httpUrl("/test/json?a=1"));
    EXPECT_EQ(503, first.status);
    EXPECT_EQ("busy", first.body);
    EXPECT_NE(std::string::npos, first.headers.find("X-Test: yes\r\n"));
    EXPECT_EQ(503, Fetch(server.httpUrl("/test/json")).status);
    EXPECT_EQ(200, Fetch(server.httpUrl("/test/json")).status);
    // Other paths were never affected.
    ASSERT_TRUE(server.script("/test/json", 418, "", 1));
    EXPECT_EQ(200, Fetch(server.httpUrl("/test/text")).status);
    EXPECT_EQ(418, Fetch(server.httpUrl("/test/json")).status);
}

TEST_F(LocalServerTest, ScriptedActionsCloseWithoutAnswer) {
    ASSERT_TRUE(server.hang("/test/json", 0.1));
    EXPECT_EQ(CURLE_GOT_NOTHING, Fetch(server.httpUrl("/test/json")).code);
    ASSERT_TRUE(server.scriptAction("/test/json", "close"));
    EXPECT_EQ(CURLE_GOT_NOTHING, Fetch(server.httpUrl("/test/json")).code);
    ASSERT_TRUE(server.scriptAction("/test/json", "reset"));
    EXPECT_EQ(CURLE_RECV_ERROR, Fetch(server.httpUrl("/test/json")).code);
    EXPECT_EQ(200, Fetch(server.httpUrl("/test/json")).status);
}

TEST_F(LocalServerTest, RecordsEveryRequestButControlCalls) {
    Fetch(server.httpUrl("/test/echo?x=1&y"), "a=1&b=\xff");
    Fetch(server.httpsUrl("/test/json"), nullptr, server.caFile());
    Json::Value all = server.requests();
    ASSERT_EQ(2u, all.size());
    EXPECT_EQ(1, all[0]["seq"].asInt());
    EXPECT_EQ("POST", all[0]["method"].asString());
    EXPECT_EQ("http", all[0]["scheme"].asString());
    EXPECT_EQ("/test/echo", all[0]["path"].asString());
    EXPECT_EQ("x=1&y", all[0]["query"].asString());
    EXPECT_EQ("POST /test/echo?x=1&y HTTP/1.1", zepatest::RecordedRequestLine(all[0]));
    EXPECT_EQ("a=1&b=\xff", RecordedBody(all[0]));
    EXPECT_EQ("7", RecordedHeader(all[0], "content-length"));
    EXPECT_GT(all[0]["client_port"].asInt(), 0);
    EXPECT_EQ("https", all[1]["scheme"].asString());
    EXPECT_EQ(1u, server.requests("/test/json").size());
    EXPECT_EQ(0u, server.requests("/nothing").size());
    ASSERT_TRUE(server.reset());
    EXPECT_EQ(0u, server.requests().size());
}

TEST_F(LocalServerTest, ResetForgetsScripts) {
    ASSERT_TRUE(server.script("/test/json", 500, "x", 5));
    ASSERT_TRUE(server.reset());
    EXPECT_EQ(200, Fetch(server.httpUrl("/test/json")).status);
}

TEST_F(LocalServerTest, BadControlCallsAreRefused) {
    std::string answer;
    long status = 0;
    ASSERT_TRUE(server.control("GET", "nothing", "", answer, status));
    EXPECT_EQ(404, status);
    ASSERT_TRUE(server.control("POST", "script", "{\"status\": 500}", answer, status));
    EXPECT_EQ(400, status);
    EXPECT_EQ(404, Fetch(server.httpUrl("/no/route")).status);
}

TEST_F(LocalServerTest, BigAnswerHasTheAskedSize) {
    Answer a = Fetch(server.httpUrl("/test/big?size=100001"));
    EXPECT_EQ(200, a.status);
    ASSERT_EQ(100001u, a.body.size());
    EXPECT_EQ("abcdef0123456789a", a.body.substr(0, 17));
}

TEST_F(LocalServerTest, CertificateNamesLoopbackAndLocalhost) {
    Answer byIp = Fetch(server.httpsUrl("/test/text"), nullptr, server.caFile());
    EXPECT_EQ(CURLE_OK, byIp.code);
    EXPECT_EQ("hello, world\n", byIp.body);
    Answer byName = Fetch("https://localhost:" + std::to_string(server.httpsPort()) + "/test/text", nullptr,
                          server.caFile());
    EXPECT_EQ(CURLE_OK, byName.code);
    Answer untrusted = Fetch(server.httpsUrl("/test/text"), nullptr, "/dev/null");
    EXPECT_NE(CURLE_OK, untrusted.code);
}

TEST(LocalServerRoutes, LoadsRouteModulesOfBothKinds) {
    zepatest::TempRoot dir;
    dir.write("/routes_one.py",
              "from zepa_localserver import json_reply, text_reply\n"
              "def register(server):\n"
              "    server.state['hits'] = 0\n"
              "    def hit(req):\n"
              "        server.state['hits'] += 1\n"
              "        return json_reply({'hits': server.state['hits'], 'form': req.form()})\n"
              "    server.route('/one', hit, methods=['POST'])\n"
              "    server.on_reset(lambda: server.state.update(hits=0))\n");
    dir.write("/routes_two.py",
              "from zepa_localserver import Reply\n"
              "ROUTES = {'/two': lambda req: Reply(201, 'made', {'X-Two': req.params().get('n', '')})}\n");
    dir.write("/not_a_route.py", "raise SystemExit(3)\n");
    LocalServer::Options options;
    options.routesDir = dir.dir();
    options.https = false;
    LocalServer server(options);
    ASSERT_TRUE(server.ok()) << server.error();
    EXPECT_EQ(0, server.httpsPort());
    Answer a = Fetch(server.httpUrl("/one"), "k=v%20w");
    EXPECT_EQ(200, a.status);
    EXPECT_EQ("{\"hits\": 1, \"form\": {\"k\": \"v w\"}}", a.body);
    EXPECT_EQ(405, Fetch(server.httpUrl("/one")).status);
    EXPECT_EQ(404, Fetch(server.httpUrl("/test/json")).status);  // only the given folder's modules
    ASSERT_TRUE(server.reset());
    EXPECT_EQ("{\"hits\": 1, \"form\": {}}", Fetch(server.httpUrl("/one"), "").body);
    Answer two = Fetch(server.httpUrl("/two?n=5"));
    EXPECT_EQ(201, two.status);
    EXPECT_EQ("made", two.body);
    EXPECT_NE(std::string::npos, two.headers.find("X-Two: 5\r\n"));
}

TEST(LocalServerRoutes, BrokenRouteAnswers500AndTheServerLivesOn) {
    zepatest::TempRoot dir;
    dir.write("/routes_bad.py",
              "from zepa_localserver import text_reply\n"
              "def register(server):\n"
              "    server.route('/bad', lambda req: 1 / 0)\n"
              "    server.route('/good', lambda req: text_reply('ok'))\n");
    LocalServer::Options options;
    options.routesDir = dir.dir();
    options.https = false;
    LocalServer server(options);
    ASSERT_TRUE(server.ok()) << server.error();
    EXPECT_EQ(500, Fetch(server.httpUrl("/bad")).status);
    EXPECT_EQ("ok", Fetch(server.httpUrl("/good")).body);
}

TEST(LocalServerRoutes, StartFailureIsReported) {
    zepatest::TempRoot dir;
    dir.write("/routes_broken.py", "def broken(:\n");
    LocalServer::Options options;
    options.routesDir = dir.dir();
    LocalServer server(options);
    EXPECT_FALSE(server.ok());
    EXPECT_NE(std::string::npos, server.error().find("SyntaxError")) << server.error();
}

TEST_F(LocalServerTest, RecordsTellWhenARequestCameAndWhatItGot) {
    const double before = static_cast<double>(time(nullptr)) - 1;
    Fetch(server.httpUrl("/test/text"));
    ASSERT_TRUE(server.script("/test/json", 503, "busy now", 1));
    Fetch(server.httpUrl("/test/json"));
    Json::Value all = server.requests();
    ASSERT_EQ(2u, all.size());
    EXPECT_GE(all[0]["time"].asDouble(), before);
    EXPECT_LE(all[0]["time"].asDouble(), static_cast<double>(time(nullptr)) + 1);
    EXPECT_GE(all[0]["answer_time"].asDouble(), all[0]["time"].asDouble());
    EXPECT_EQ(200, all[0]["answer_status"].asInt());
    EXPECT_EQ("hello, world\n", all[0]["answer_latin1"].asString());
    EXPECT_EQ(503, all[1]["answer_status"].asInt());
    EXPECT_EQ("busy now", all[1]["answer_latin1"].asString());
    // Only what came after a record number.
    std::string answer;
    long status = 0;
    ASSERT_TRUE(server.control("GET", "requests?since=1", "", answer, status));
    EXPECT_EQ(200, status);
    EXPECT_EQ(std::string::npos, answer.find("\"seq\": 1,")) << answer;
    EXPECT_NE(std::string::npos, answer.find("\"seq\": 2,")) << answer;
    answer.clear();
    ASSERT_TRUE(server.control("GET", "requests?since=x", "", answer, status));
    EXPECT_EQ(400, status);
}

TEST_F(LocalServerTest, RefusedPortRefusesConnectionsUntilItIsBack) {
    std::string answer;
    long status = 0;
    ASSERT_TRUE(server.control("POST", "refuse", "{\"scheme\": \"https\", \"on\": true}", answer, status));
    EXPECT_EQ(200, status) << answer;
    EXPECT_FALSE(Accepts(server.httpsPort()));
    EXPECT_EQ(CURLE_COULDNT_CONNECT, Fetch(server.httpsUrl("/test/text"), nullptr, server.caFile()).code);
    // The other port and its control API serve on.
    EXPECT_EQ("hello, world\n", Fetch(server.httpUrl("/test/text")).body);
    ASSERT_TRUE(server.control("POST", "refuse", "{\"scheme\": \"https\", \"on\": false}", answer, status));
    EXPECT_EQ(200, status) << answer;
    EXPECT_EQ("hello, world\n", Fetch(server.httpsUrl("/test/text"), nullptr, server.caFile()).body);
    // A timed refusal ends by itself.
    ASSERT_TRUE(server.control("POST", "refuse", "{\"scheme\": \"https\", \"on\": true, \"seconds\": 0.3}",
                               answer, status));
    EXPECT_FALSE(Accepts(server.httpsPort()));
    bool back = false;
    for (int i = 0; i < 100 && !back; ++i) {
        usleep(50 * 1000);
        back = Accepts(server.httpsPort());
    }
    EXPECT_TRUE(back);
    answer.clear();
    ASSERT_TRUE(server.control("GET", "requests", "", answer, status));
    const Json::Value all = zepatest::ParseJson(answer);
    ASSERT_EQ(2u, all["refusals"].size()) << answer;
    EXPECT_EQ("https", all["refusals"][0]["scheme"].asString());
    EXPECT_LE(all["refusals"][0]["from"].asDouble(), all["refusals"][0]["to"].asDouble());
    EXPECT_LT(all["refusals"][0]["to"].asDouble(), all["refusals"][1]["from"].asDouble());
    EXPECT_FALSE(all["refusals"][1]["to"].isNull());
    ASSERT_TRUE(server.control("POST", "refuse", "{\"scheme\": \"ftp\", \"on\": true}", answer, status));
    EXPECT_EQ(400, status);
}

TEST(LocalServerRecords, KeepsAtMostTheNewestRecords) {
    LocalServer::Options options;
    options.https = false;
    options.extraArgs = {"--max-records", "3"};
    LocalServer server(options);
    ASSERT_TRUE(server.ok()) << server.error();
    for (int i = 0; i < 5; ++i) Fetch(server.httpUrl("/test/text?n=" + std::to_string(i)));
    Json::Value all = server.requests();
    ASSERT_EQ(3u, all.size());
    EXPECT_EQ(3, all[0]["seq"].asInt());
    EXPECT_EQ("n=4", all[2]["query"].asString());
    std::string answer;
    long status = 0;
    ASSERT_TRUE(server.control("GET", "requests", "", answer, status));
    EXPECT_NE(std::string::npos, answer.find("\"dropped\": 2")) << answer;
}
