// The local HTTP/HTTPS test server (tools/localserver/zepa_localserver.py) as
// a child process: started with a private certificate folder, ready once it
// has written its ports, stopped (SIGTERM, then SIGKILL) and reaped on
// destruction. Control calls go over plain HTTP with libcurl.
#ifndef ZEPARELAYD_TESTS_SUPPORT_LOCAL_SERVER_H
#define ZEPARELAYD_TESTS_SUPPORT_LOCAL_SERVER_H

#include <json/value.h>
#include <sys/types.h>

#include <map>
#include <string>
#include <vector>

namespace zepatest {

class LocalServer {
public:
    struct Options {
        bool https = true;
        // Folder of routes_*.py modules; empty means the server's own folder.
        std::string routesDir;
        std::vector<std::string> extraArgs;
    };

    LocalServer();
    explicit LocalServer(const Options& options);
    ~LocalServer();
    LocalServer(const LocalServer&) = delete;
    LocalServer& operator=(const LocalServer&) = delete;

    // False when the server did not come up (the reason is in error()).
    bool ok() const { return _ok; }
    const std::string& error() const { return _error; }
    pid_t pid() const { return _pid; }

    int httpPort() const { return _httpPort; }
    int httpsPort() const { return _httpsPort; }
    // "http://127.0.0.1:<port>" + path.
    std::string httpUrl(const std::string& path = "") const;
    std::string httpsUrl(const std::string& path = "") const;
    // The throwaway CA's certificate (PEM).
    const std::string& caFile() const { return _caFile; }
    const std::string& certDir() const { return _certDir; }
    // The ready file's "relay" object (started with --relay), else null.
    const Json::Value& relayInfo() const { return _relay; }

    // The next count answers of path: status, body and headers.
    bool script(const std::string& path, int status, const std::string& body, int count = 1,
                const std::map<std::string, std::string>& headers = {});
    // The next count requests of path wait seconds, then the connection is
    // closed without an answer.
    bool hang(const std::string& path, double seconds, int count = 1);
    // action "close" (no answer) or "reset" (TCP reset) for the next count.
    bool scriptAction(const std::string& path, const std::string& action, int count = 1);
    // Any script object of the control API.
    bool scriptRaw(const Json::Value& plan);
    // Every recorded request (of path, when given), in arrival order.
    Json::Value requests(const std::string& path = "") const;
    // Forgets records and scripts.
    bool reset();

    // Stops the server now (SIGTERM, after 5 s SIGKILL) and reaps it. The
    // wait status, or -1 when no server ran. The destructor does the same.
    int stop();

    // Plain libcurl call on the control API; false on transport failure.
    bool control(const std::string& method, const std::string& path, const std::string& body,
                 std::string& answer, long& status) const;

private:
    void Start(const Options& options);

    bool _ok = false;
    std::string _error;
    pid_t _pid = -1;
    std::string _dir;
    std::string _certDir;
    std::string _caFile;
    int _httpPort = 0;
    int _httpsPort = 0;
    Json::Value _relay;
};

// Decodes a recorded body ("body_base64") into bytes.
std::string RecordedBody(const Json::Value& record);
// The request line exactly as received ("GET /x?a=1 HTTP/1.1").
std::string RecordedRequestLine(const Json::Value& record);
// The value of the first recorded header of that name (case-insensitive), or "".
std::string RecordedHeader(const Json::Value& record, const std::string& name);
// Number of recorded headers of that name.
int RecordedHeaderCount(const Json::Value& record, const std::string& name);

}  // namespace zepatest

#endif
