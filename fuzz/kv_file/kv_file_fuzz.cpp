// Any bytes as a key/value file: readers must not crash, and a value written
// with the setter must read back unchanged while every other line is kept.
#include <unistd.h>
#include <zepasdk/kv.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <string>

namespace {

const std::string& Dir() {
    static std::string dir = [] {
        static char tmpl[] = "/tmp/zepafuzz.XXXXXX";
        std::string made = mkdtemp(tmpl);
        atexit([] {
            unlink((std::string(tmpl) + "/f.conf").c_str());
            rmdir(tmpl);
        });
        return made;
    }();
    return dir;
}

void Check(bool ok, const char* what) {
    if (!ok) {
        fprintf(stderr, "property failed: %s\n", what);
        abort();
    }
}

size_t CountLines(const std::string& s) {
    size_t n = 0;
    for (char c : s) n += c == '\n';
    return n + (!s.empty() && s.back() != '\n');
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string file = Dir() + "/f.conf";
    std::string text(reinterpret_cast<const char*>(data), size);
    {
        std::ofstream out(file, std::ios::binary | std::ios::trunc);
        out << text;
    }
    char buf[64];
    VLIBCFileGetKeyValue(file.c_str(), "a", buf, sizeof(buf));
    Check(strlen(buf) < sizeof(buf), "value fits its buffer");
    VLIBCFileCheckKeyValue(file.c_str(), "a", "yes", 1);
    PVLIBCSzList list = VLIBCSzListAlloc(2);
    int sections = VLIBCFileEnumSection(file.c_str(), &list);
    Check(sections == list->nItem, "section count matches the list");
    for (int i = 0; i < list->nItem; ++i)
        VLIBCFileGetSectionValue(file.c_str(), VLIBCSzListGet(list, i), "s_port", buf, sizeof(buf));
    VLIBCSzListFree(list);

    // Round trip: the value set is the value read; no other line is lost.
    std::string value = text.substr(0, 40);
    for (char& c : value)
        if (c == '\n' || c == '\0') c = ' ';
    Check(VLIBCFileSetKeyValue(file.c_str(), "fuzz key", value.c_str()) == 0, "set succeeds");
    char back[128];
    int n = VLIBCFileGetKeyValue(file.c_str(), "fuzz key", back, sizeof(back));
    std::string expect = value;
    // Unquoted-looking values are stored quoted, so they read back whole.
    Check(n == static_cast<int>(expect.size()) && expect == back, "value reads back unchanged");
    std::ifstream in(file, std::ios::binary);
    std::ostringstream after;
    after << in.rdbuf();
    Check(CountLines(after.str()) >= CountLines(text), "no line is lost");
    return 0;
}
