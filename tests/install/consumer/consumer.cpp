// A program outside the project that uses the installed library.
#include <iostream>

#include <zeparelayd/errors.h>

int main() {
    using namespace ZEPA::Relay;
    Json::Value answer;
    answer["errno"] = 9;
    std::cout << GetErrorStr(RespErrMap(RELAYSERVER_ERR_SESSION_TIMEOUT)) << ' '
              << GetStateStr(RELAYD_STATE_CONNECTED_ALT) << ' '
              << GetServerErrorStr(static_cast<RELAYSERVER_ERR>(12)) << ' ' << ParseServerError(answer)
              << std::endl;
    return 0;
}
