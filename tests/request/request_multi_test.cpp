// Requests driven through a caller-owned curl multi handle: a real event loop
// over poll with the socket and timer callbacks.
#include <curl/curl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/socket.h>
#include <time.h>

#include <map>
#include <memory>
#include <vector>

#include <zeparelayd/request.h>

#include "request/request_fixture.h"

using namespace ZEPA::Relay;
using requesttest::ServerTest;
using zepatest::LogContains;
using zepatest::StderrCapture;

namespace {

struct SocketOptions {
    int keepAlive = -1;
    int idle = -1;
    int interval = -1;
};

// The caller's side of the multi interface, as the daemon program runs it.
class MultiLoop {
public:
    MultiLoop() {
        _multi = curl_multi_init();
        curl_multi_setopt(_multi, CURLMOPT_SOCKETFUNCTION, OnSocket);
        curl_multi_setopt(_multi, CURLMOPT_SOCKETDATA, this);
        curl_multi_setopt(_multi, CURLMOPT_TIMERFUNCTION, OnTimer);
        curl_multi_setopt(_multi, CURLMOPT_TIMERDATA, this);
    }
    ~MultiLoop() { curl_multi_cleanup(_multi); }

    CURLM* multi() { return _multi; }

    // Runs until every request handed over is finished (JobDone, JobRemove)
    // or the deadline passes. Returns the number still pending.
    size_t Run(std::vector<Request*> requests, int deadlineMs = 8000) {
        const long start = NowMs();
        while (!requests.empty() && NowMs() - start < deadlineMs) {
            WaitAndAct();
            Collect(requests);
        }
        return requests.size();
    }

    // Options seen on each easy handle's socket when libcurl announced it.
    std::map<CURL*, SocketOptions> socketOptions;
    std::vector<Request*> finishOrder;

private:
    static long NowMs() {
        struct timespec ts;
        clock_gettime(CLOCK_MONOTONIC, &ts);
        return ts.tv_sec * 1000 + ts.tv_nsec / 1000000;
    }

    static int OnSocket(CURL* easy, curl_socket_t s, int what, void* userp, void* /*socketp*/) {
        MultiLoop* loop = static_cast<MultiLoop*>(userp);
        if (what == CURL_POLL_REMOVE) {
            loop->_sockets.erase(s);
            return 0;
        }
        loop->_sockets[s] = what;
        SocketOptions& o = loop->socketOptions[easy];
        socklen_t len = sizeof(int);
        getsockopt(s, SOL_SOCKET, SO_KEEPALIVE, &o.keepAlive, &len);
        len = sizeof(int);
        getsockopt(s, IPPROTO_TCP, TCP_KEEPIDLE, &o.idle, &len);
        len = sizeof(int);
        getsockopt(s, IPPROTO_TCP, TCP_KEEPINTVL, &o.interval, &len);
        return 0;
    }

    static int OnTimer(CURLM* /*multi*/, long timeoutMs, void* userp) {
        static_cast<MultiLoop*>(userp)->_timeoutMs = timeoutMs;
        return 0;
    }

    void WaitAndAct() {
        std::vector<struct pollfd> fds;
        for (const auto& s : _sockets) {
            short events = 0;
            if (s.second & CURL_POLL_IN) events |= POLLIN;
            if (s.second & CURL_POLL_OUT) events |= POLLOUT;
            fds.push_back({s.first, events, 0});
        }
        int timeout = _timeoutMs < 0 ? 100 : static_cast<int>(_timeoutMs);
        int ready = poll(fds.data(), fds.size(), timeout);
        int running = 0;
        if (ready <= 0) {
            _timeoutMs = -1;
            curl_multi_socket_action(_multi, CURL_SOCKET_TIMEOUT, 0, &running);
            return;
        }
        for (const struct pollfd& p : fds) {
            if (p.revents == 0) continue;
            int mask = 0;
            if (p.revents & (POLLIN | POLLHUP)) mask |= CURL_CSELECT_IN;
            if (p.revents & POLLOUT) mask |= CURL_CSELECT_OUT;
            if (p.revents & POLLERR) mask |= CURL_CSELECT_ERR;
            curl_multi_socket_action(_multi, p.fd, mask, &running);
        }
    }

    void Collect(std::vector<Request*>& pending) {
        int left = 0;
        while (CURLMsg* msg = curl_multi_info_read(_multi, &left)) {
            if (msg->msg != CURLMSG_DONE) continue;
            for (auto it = pending.begin(); it != pending.end(); ++it) {
                Request* r = *it;
                if (*r != msg->easy_handle) continue;
                EXPECT_TRUE(r->JobDone(msg->data.result));
                Json::Value record;
                r->Write(record);
                EXPECT_EQ("async", record["mode"].asString());
                EXPECT_TRUE(r->JobRemove(_multi));
                finishOrder.push_back(r);
                pending.erase(it);
                break;
            }
        }
    }

    CURLM* _multi;
    std::map<curl_socket_t, int> _sockets;
    long _timeoutMs = -1;
};

std::unique_ptr<Request> Make(const std::string& url, const char* data, bool post) {
    return std::unique_ptr<Request>(new Request(url.c_str(), data, post));
}

}  // namespace

using RequestMulti = ServerTest;

TEST_F(RequestMulti, SeveralRequestsRunAtOnceAndAreFoundByTheirHandles) {
    ASSERT_TRUE(server.hang("/test/text", 2.0));
    const std::string refused = "http://127.0.0.1:" + std::to_string(requesttest::ClosedLoopbackPort()) + "/";
    auto json = Make(server.httpUrl("/test/json"), "", false);
    auto post = Make(server.httpUrl("/test/echo"), "x=1&y=2", true);
    auto busy = Make(server.httpUrl("/test/busy"), "", false);
    auto hung = Make(server.httpUrl("/test/text"), "", false);
    auto tls = Make(server.httpsUrl("/test/echo"), "t=1", true);
    auto refusedReq = Make(refused, "", false);
    auto unresolved = Make("http://" + requesttest::UnresolvableHost() + "/", "", false);
    std::vector<Request*> all = {json.get(), post.get(),       busy.get(),      hung.get(),
                                 tls.get(),  refusedReq.get(), unresolved.get()};

    MultiLoop loop;
    for (Request* r : all) ASSERT_TRUE(r->JobAdd(loop.multi()));
    Json::Value record;
    json->Write(record);
    EXPECT_EQ("async", record["mode"].asString());
    EXPECT_FALSE(record.isMember("http_status"));
    // A request in a multi job refuses a synchronous send.
    EXPECT_FALSE(json->Send());

    ASSERT_EQ(0u, loop.Run(all));
    EXPECT_EQ(all.size(), loop.finishOrder.size());
    // The hung request closes last of the ones that reach the server.
    EXPECT_EQ(hung.get(), loop.finishOrder.back());

    EXPECT_EQ(200, json->GetHttpStatus());
    EXPECT_EQ(RELAYD_SUCCESS, json->GetError());
    Json::Value answer;
    ASSERT_TRUE(json->GetResponse(answer));
    EXPECT_EQ(0, answer["errno"].asInt());

    ASSERT_TRUE(post->GetResponse(answer));
    EXPECT_EQ("POST", answer["method"].asString());
    EXPECT_EQ("x=1&y=2", answer["body_latin1"].asString());

    EXPECT_EQ(503, busy->GetHttpStatus());
    EXPECT_EQ(RELAYD_ERR_SERVER_BUSY, busy->GetError());

    EXPECT_EQ(CURLE_GOT_NOTHING, hung->GetCurlResult());
    EXPECT_EQ(2, static_cast<int>(hung->GetError()));

    ASSERT_TRUE(tls->GetResponse(answer));
    EXPECT_EQ("https", answer["scheme"].asString());
    EXPECT_EQ("t=1", answer["body_latin1"].asString());

    EXPECT_EQ(CURLE_COULDNT_CONNECT, refusedReq->GetCurlResult());
    EXPECT_EQ(RELAYD_ERR_NETWORK, refusedReq->GetError());
    EXPECT_EQ(CURLE_COULDNT_RESOLVE_HOST, unresolved->GetCurlResult());
    EXPECT_EQ(RELAYD_ERR_RESOLV, unresolved->GetError());

    // Done after a failure: the record holds what libcurl reported as status.
    hung->Write(record);
    EXPECT_EQ("sync", record["mode"].asString());
    EXPECT_EQ(0, record["http_status"].asInt());
    EXPECT_EQ("", record["response"].asString());

    // Removed requests are no longer valid, their results stay readable.
    for (Request* r : all) EXPECT_FALSE(r->IsValid());
    EXPECT_EQ(1u, server.requests("/test/json").size());
    EXPECT_EQ(1u, server.requests("/test/text").size());
}

TEST_F(RequestMulti, SendAfterJobRemoveSendsNothing) {
    auto request = Make(server.httpUrl("/test/json"), "", false);
    MultiLoop loop;
    ASSERT_TRUE(request->JobAdd(loop.multi()));
    ASSERT_EQ(0u, loop.Run({request.get()}));
    EXPECT_EQ(200, request->GetHttpStatus());
    EXPECT_FALSE(request->Send());
    EXPECT_FALSE(request->JobAdd(loop.multi()));
    EXPECT_EQ(1u, server.requests().size());
    EXPECT_EQ(200, request->GetHttpStatus());
    EXPECT_NE(std::string::npos, request->GetResponse().find("\"errno\": 0"));
}

TEST_F(RequestMulti, RemovingBeforeTheEndAbandonsTheTransfer) {
    ASSERT_TRUE(server.hang("/test/json", 3));
    auto request = Make(server.httpUrl("/test/json"), "", false);
    MultiLoop loop;
    ASSERT_TRUE(request->JobAdd(loop.multi()));
    EXPECT_TRUE(request->JobRemove(loop.multi()));
    EXPECT_FALSE(request->IsValid());
    EXPECT_FALSE(request->Send());
    Json::Value record;
    request->Write(record);
    EXPECT_EQ("sync", record["mode"].asString());
    EXPECT_FALSE(record.isMember("http_status"));
}

TEST_F(RequestMulti, JobCallsRefuseBadArguments) {
    auto request = Make(server.httpUrl("/test/json"), "", false);
    Request invalid(nullptr, nullptr, false);
    MultiLoop loop;
    StderrCapture capture;
    EXPECT_FALSE(request->JobAdd(nullptr));
    EXPECT_FALSE(invalid.JobAdd(loop.multi()));
    EXPECT_FALSE(request->JobRemove(nullptr));
    EXPECT_EQ("", capture.stop());
    EXPECT_TRUE(request->IsValid());
}

TEST_F(RequestMulti, AddingTwiceAndRemovingTwiceAreLogged) {
    auto request = Make(server.httpUrl("/test/json"), "", false);
    MultiLoop loop;
    ASSERT_TRUE(request->JobAdd(loop.multi()));
    StderrCapture capture;
    EXPECT_FALSE(request->JobAdd(loop.multi()));
    EXPECT_TRUE(LogContains(capture.stop(), " curl_multi_add_handle() failed"));
    ASSERT_EQ(0u, loop.Run({request.get()}));
    StderrCapture again;
    EXPECT_FALSE(request->JobRemove(loop.multi()));
    EXPECT_TRUE(LogContains(again.stop(), " curl_multi_remove_handle() failed"));
}

TEST_F(RequestMulti, KeepAliveIsSetOnTheConnection) {
    auto plain = Make(server.httpUrl("/test/json"), "", false);
    auto kept = Make(server.httpUrl("/test/text"), "", false);
    EXPECT_TRUE(kept->SetTcpKeepAlive(7));
    CURL* keptHandle = kept->GetCurlHandle();
    CURL* plainHandle = plain->GetCurlHandle();
    MultiLoop loop;
    ASSERT_TRUE(plain->JobAdd(loop.multi()));
    ASSERT_TRUE(kept->JobAdd(loop.multi()));
    ASSERT_EQ(0u, loop.Run({plain.get(), kept.get()}));
    ASSERT_EQ(1u, loop.socketOptions.count(keptHandle));
    EXPECT_EQ(1, loop.socketOptions[keptHandle].keepAlive);
    EXPECT_EQ(7, loop.socketOptions[keptHandle].idle);
    EXPECT_EQ(7, loop.socketOptions[keptHandle].interval);
    ASSERT_EQ(1u, loop.socketOptions.count(plainHandle));
    EXPECT_EQ(0, loop.socketOptions[plainHandle].keepAlive);
    EXPECT_EQ(RELAYD_SUCCESS, kept->GetError());
}

TEST_F(RequestMulti, EqualityComparesTheEasyHandle) {
    auto a = Make(server.httpUrl("/test/json"), "", false);
    auto b = Make(server.httpUrl("/test/json"), "", false);
    EXPECT_TRUE(*a == a->GetCurlHandle());
    EXPECT_FALSE(*a != a->GetCurlHandle());
    EXPECT_FALSE(*a == b->GetCurlHandle());
    EXPECT_TRUE(*a != b->GetCurlHandle());
    EXPECT_TRUE(*a != nullptr);
    Request invalid(nullptr, nullptr, false);
    EXPECT_TRUE(invalid == nullptr);
}
