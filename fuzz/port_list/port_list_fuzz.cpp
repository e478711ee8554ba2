// Any text as a port list: the parser must not crash, the counting call and
// the filling call must agree, every port is in range, and a parsed list
// written back as single ports parses to the same list.
#include <zepasdk/service.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

namespace {

constexpr int kMaxPorts = 1 << 20;

void Check(bool ok, const char* what) {
    if (!ok) {
        fprintf(stderr, "property failed: %s\n", what);
        abort();
    }
}

std::vector<int> Parse(const std::string& text, int& count) {
    count = VLibParsePorts(text.c_str(), nullptr, 0);
    if (count < 0 || count > kMaxPorts) return {};
    std::vector<int> ports(static_cast<size_t>(count) + 1, -1);
    int filled = VLibParsePorts(text.c_str(), ports.data(), count);
    Check(filled == count, "count and fill agree");
    Check(ports[static_cast<size_t>(count)] == -1, "no write past the given room");
    if (count > 0)
        Check(VLibParsePorts(text.c_str(), ports.data(), count - 1) == -1, "too little room fails");
    ports.resize(static_cast<size_t>(count));
    return ports;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string text(reinterpret_cast<const char*>(data), size);
    if (text.find('\0') != std::string::npos) return 0;
    int count = 0;
    std::vector<int> ports = Parse(text, count);
    Check(count == -1 || count > 0, "a list is never empty");
    if (count <= 0 || count > kMaxPorts) return 0;
    std::string singles;
    for (int port : ports) {
        Check(port >= 0 && port <= 65535, "port in range");
        if (!singles.empty()) singles += ",";
        singles += std::to_string(port);
    }
    int again = 0;
    Check(Parse(singles, again) == ports, "written back, the same list");
    return 0;
}
