// Process-wide state of the requests: the share handle, the DNS-cache reset
// and the cookies.
#include <curl/curl.h>
#include <gtest/gtest.h>

#include <list>

#include <zeparelayd/daemon.h>
#include <zeparelayd/request.h>

#include "request/request_fixture.h"

using namespace ZEPA::Relay;
using requesttest::ServerTest;
using zepatest::LogContains;
using zepatest::RecordedHeader;
using zepatest::StderrCapture;

namespace {

// Puts a cookie line straight into a share's store, through a handle of the test's own.
void AddCookie(CURLSH* share, const std::string& line) {
    CURL* curl = curl_easy_init();
    ASSERT_EQ(CURLE_OK, curl_easy_setopt(curl, CURLOPT_SHARE, share));
    ASSERT_EQ(CURLE_OK, curl_easy_setopt(curl, CURLOPT_COOKIELIST, line.c_str()));
    curl_easy_cleanup(curl);
}

std::string CookieLine(const std::string& domain, const std::string& name, const std::string& value) {
    return domain + "\tFALSE\t/\tFALSE\t0\t" + name + "\t" + value;
}

}  // namespace

using RequestShared = ServerTest;

TEST_F(RequestShared, ShareIsMadeOnceAndReplacedOnRenewal) {
    EXPECT_FALSE(Request::blForbidConnReuse);
    CURLSH* first = Request::GetCurlShare(false);
    ASSERT_NE(nullptr, first);
    EXPECT_EQ(first, Request::GetCurlShare(false));
    EXPECT_EQ(first, Request::_share);
    EXPECT_FALSE(Request::blForbidConnReuse);
    StderrCapture capture;
    CURLSH* second = Request::GetCurlShare(true);
    // Nobody used the first one: it is freed without a word.
    EXPECT_EQ("", capture.stop());
    ASSERT_NE(nullptr, second);
    EXPECT_EQ(second, Request::_share);
    EXPECT_TRUE(Request::blForbidConnReuse);
}

TEST_F(RequestShared, CookieStringIsSentWithEveryRequest) {
    EXPECT_EQ("", Request::GetCookie());
    EXPECT_TRUE(Request::SetCookie("a=1; b=2"));
    EXPECT_EQ("a=1; b=2", Request::GetCookie());
    EXPECT_EQ(&Request::_strCookie, &Request::GetCookie());
    Request post(server.httpUrl("/test/echo").c_str(), "x=1", true);
    Request get(server.httpsUrl("/test/echo").c_str(), "", false);
    ASSERT_TRUE(post.Send());
    ASSERT_TRUE(get.Send());
    Json::Value records = server.requests("/test/echo");
    ASSERT_EQ(2u, records.size());
    for (const Json::Value& rec : records) {
        EXPECT_EQ("a=1; b=2", RecordedHeader(rec, "Cookie"));
        EXPECT_EQ(1, zepatest::RecordedHeaderCount(rec, "Cookie"));
    }
}

TEST_F(RequestShared, CookieStringIsTakenAtSetUp) {
    Request request(server.httpUrl("/test/echo").c_str(), "", false);
    Request::SetCookie("late=1");
    ASSERT_TRUE(request.Send());
    EXPECT_EQ("", RecordedHeader(OnlyRecord("/test/echo"), "Cookie"));
}

TEST_F(RequestShared, ServerCookiesAreKeptForTheRequestHost) {
    Request request(server.httpUrl("/test/cookie").c_str(), "sid=abc&h_token=secret", false);
    std::list<std::string> cookies = {"untouched"};
    EXPECT_FALSE(request.GetCookies(cookies));
    EXPECT_EQ(std::list<std::string>{"untouched"}, cookies);
    ASSERT_TRUE(request.Send());
    ASSERT_TRUE(request.GetCookies(cookies));
    // The HttpOnly cookie's line starts with libcurl's marker, not the host.
    EXPECT_EQ(std::list<std::string>{CookieLine("127.0.0.1", "sid", "abc")}, cookies);
}

TEST_F(RequestShared, CookiesOfOneRequestAreSentByTheNext) {
    Request setter(server.httpUrl("/test/cookie").c_str(), "sid=abc", false);
    ASSERT_TRUE(setter.Send());
    Request::SetCookie("fixed=1");
    Request next(server.httpsUrl("/test/echo").c_str(), "", false);
    Request plain(server.httpUrl("/test/echo").c_str(), "a=1", true);
    ASSERT_TRUE(plain.Send());
    ASSERT_TRUE(next.Send());
    Json::Value records = server.requests("/test/echo");
    ASSERT_EQ(2u, records.size());
    // libcurl puts the stored cookie first and the fixed string after it.
    EXPECT_EQ("sid=abc; fixed=1", RecordedHeader(records[0], "Cookie"));
    // The stored cookie belongs to the host, whatever the scheme.
    EXPECT_EQ("sid=abc; fixed=1", RecordedHeader(records[1], "Cookie"));
}

TEST_F(RequestShared, CookieListGrowsWithEverySave) {
    Request request(server.httpUrl("/test/cookie").c_str(), "sid=abc", false);
    ASSERT_TRUE(request.Send());
    EXPECT_TRUE(request.SaveCookies());
    std::list<std::string> cookies;
    ASSERT_TRUE(request.GetCookies(cookies));
    EXPECT_EQ(2u, cookies.size());
    EXPECT_EQ(cookies.front(), cookies.back());
}

TEST_F(RequestShared, CookiesOfOtherHostsAreNotKept) {
    CURLSH* share = Request::GetCurlShare(false);
    AddCookie(share, CookieLine("localhost", "other", "1"));
    AddCookie(share, "#HttpOnly_" + CookieLine("127.0.0.1", "marked", "1"));
    AddCookie(share, "127.0.0.1\tTRUE\t/\tFALSE\t0\ttail\t1");
    AddCookie(share, CookieLine("127.0.0.1", "mine", "1"));
    Request request(server.httpUrl("/test/json").c_str(), "", false);
    EXPECT_TRUE(request.SaveCookies());
    std::list<std::string> cookies;
    ASSERT_TRUE(request.GetCookies(cookies));
    EXPECT_EQ(std::list<std::string>{CookieLine("127.0.0.1", "mine", "1")}, cookies);
}

TEST_F(RequestShared, LongHostIsComparedOnItsFirst127Characters) {
    const std::string host = std::string(140, 'h') + ".test";
    const std::string prefix = host.substr(0, 127);
    CURLSH* share = Request::GetCurlShare(false);
    AddCookie(share, CookieLine(prefix + "-other", "cut", "1"));
    AddCookie(share, CookieLine(std::string(126, 'h') + "x", "differs", "1"));
    Request request(("http://" + host + ":80/path").c_str(), "", false);
    ASSERT_TRUE(request.IsValid());
    EXPECT_TRUE(request.SaveCookies());
    std::list<std::string> cookies;
    ASSERT_TRUE(request.GetCookies(cookies));
    EXPECT_EQ(std::list<std::string>{CookieLine(prefix + "-other", "cut", "1")}, cookies);
}

TEST_F(RequestShared, UrlWithoutSlashKeepsNoCookie) {
    AddCookie(Request::GetCurlShare(false), CookieLine("127.0.0.1", "sid", "1"));
    Request request(("127.0.0.1:" + std::to_string(server.httpPort())).c_str(), "", false);
    EXPECT_TRUE(request.SaveCookies());
    std::list<std::string> cookies;
    EXPECT_FALSE(request.GetCookies(cookies));
}

TEST_F(RequestShared, SaveCookiesWithoutHandleFails) {
    Request request(nullptr, nullptr, false);
    StderrCapture capture;
    EXPECT_FALSE(request.SaveCookies());
    EXPECT_TRUE(LogContains(capture.stop(), " curl_easy_getinfo failed: 43"));
}

TEST_F(RequestShared, CleanDnsCacheLeavesLiveRequestsOnTheOldShare) {
    Daemon::_logLevel = 5;
    Request old(server.httpUrl("/test/cookie").c_str(), "sid=old", false);
    StderrCapture capture;
    EXPECT_TRUE(Request::CleanDnsCache());
    std::string log = capture.stop();
    // The old share is still in use by the request above: abandoned, not freed.
    EXPECT_TRUE(LogContains(log, " curl_share_cleanup failed. [2:Share currently in use]")) << log;
    EXPECT_TRUE(Request::blForbidConnReuse);
    CURLSH* newShare = Request::GetCurlShare(false);
    EXPECT_NE(nullptr, newShare);

    // The old request still works, on the old share's cookie store.
    ASSERT_TRUE(old.Send());
    Request fresh(server.httpUrl("/test/echo").c_str(), "", false);
    ASSERT_TRUE(fresh.Send());
    EXPECT_EQ("", RecordedHeader(OnlyRecord("/test/echo"), "Cookie"));
    EXPECT_EQ(newShare, Request::_share);
}

TEST_F(RequestShared, AbandonedShareIsFreedOnceItsUsersAreGone) {
    Daemon::_logLevel = 5;
    {
        Request old(server.httpUrl("/test/json").c_str(), "", false);
        ASSERT_TRUE(old.Send());
        Request::CleanDnsCache();
    }
    // The last user of the abandoned share is gone, and so is the share: the
    // next renewal finds nothing in use and says nothing.
    StderrCapture capture;
    Request::GetCurlShare(true);
    EXPECT_EQ("", capture.stop());
    Request next(server.httpUrl("/test/json").c_str(), "", false);
    EXPECT_TRUE(next.Send());
}
