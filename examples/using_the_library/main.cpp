// The README's "Using the library" example as a program of its own, built
// against an installed libzeparelayd.
//   usage: using_the_library [ROOT]     (ROOT: the system root, "/" by default)
#include <iostream>

#include <zeparelayd/config.h>
#include <zeparelayd/daemon.h>
#include <zeparelayd/errors.h>
#include <zeparelayd/request.h>
#include <zepasdk/sysroot.h>

using namespace ZEPA::Relay;

int main(int argc, char** argv) {
    // Every fixed path the library and the SDK use is taken below this root.
    // A path the program names itself must be built below it the same way.
    if (ZEPASysRootSet(argc > 1 ? argv[1] : "/") != 0) return 2;
    char confPath[4096];
    if (ZEPASysRootPath("/usr/zepa/etc/zeparelayd/zeparelayd.conf", confPath, sizeof(confPath)) < 0) return 2;

    RelaydConf conf(confPath);  // defaults when unreadable (logged)
    std::cout << conf;          // full form, one JSON line

    Request req(conf.serverControl.GetUrl(nullptr), Json::Value(Json::objectValue), true);
    Json::Value answer;
    if (req.Send() && req.GetResponse(answer))
        std::cout << GetErrorStr(RespErrMap(ParseServerError(answer))) << "\n";  // "success", "err_auth", ...
    else
        std::cout << GetErrorStr(req.GetError()) << "\n";  // "err_resolv", "err_network", ...

    std::string serverId, state, error;  // as any other process would ask
    Daemon::GetStatus(serverId, state, error, nullptr);
    std::cout << state << "\n";  // "connected", "not_running", ...
    return 0;
}
