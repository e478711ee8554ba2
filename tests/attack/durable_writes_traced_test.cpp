// The system calls that make a write durable, as the kernel sees them: a
// configuration write through the library and a key/value write through the
// system library each sync the new file, rename it onto the target and sync
// the folder, in that order, every time. Traced with strace.
#include <limits.h>
#include <stdio.h>
#include <stdlib.h>

#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "support/test_support.h"

namespace {

const char kWriter[] = ZEPA_JSON_WRITER;

std::string StracePath() { return zepatest::FindProgram("strace"); }

bool StraceWorks(std::string& why) {
    if (StracePath().empty()) {
        why = "strace is not installed (scripts/install-deps.sh installs it)";
        return false;
    }
    if (system("strace -qq -o /dev/null true >/dev/null 2>&1") != 0) {
        why = "strace may not trace here (ptrace not permitted)";
        return false;
    }
    return true;
}

std::vector<std::string> Lines(const std::string& text) {
    std::vector<std::string> lines;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);) lines.push_back(line);
    return lines;
}

// "fsync <path>" and "rename <from> <to>" for each traced call, in order.
std::vector<std::string> Events(const std::string& trace) {
    std::vector<std::string> events;
    const std::regex sync(R"re(^f(data)?sync\(\d+<([^>]*)>\)\s*= 0)re");
    const std::regex rename(R"re(^rename(at2?)?\((?:AT_FDCWD, )?"([^"]*)", (?:AT_FDCWD, )?"([^"]*)".*= 0)re");
    std::smatch m;
    for (const std::string& line : Lines(trace)) {
        if (std::regex_search(line, m, sync)) {
            events.push_back("fsync " + m[2].str());
        } else if (std::regex_search(line, m, rename)) {
            events.push_back("rename " + m[2].str() + " " + m[3].str());
        }
    }
    return events;
}

class DurableWritesTraced : public zepatest::RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        std::string why;
        if (!StraceWorks(why)) GTEST_SKIP() << why;
        root.mkdir("/conf");
        char real[PATH_MAX];
        ASSERT_NE(nullptr, realpath(root.path("/conf").c_str(), real));
        folder = real;
    }
    // Runs the writer under strace and gives the durable calls it made.
    std::vector<std::string> Trace(const std::vector<std::string>& args) {
        const std::string log = root.path("/trace.log");
        std::vector<std::string> command = {
            StracePath(), "-qq", "-y", "-o", log, "-e", "trace=fsync,fdatasync,rename,renameat,renameat2",
            kWriter};
        // LeakSanitizer cannot run under ptrace: a sanitizer build's writer
        // goes without it here.
        const char* asan = getenv("ASAN_OPTIONS");
        command.insert(command.begin() + 1, {"-E", std::string("ASAN_OPTIONS=") +
                                                       (asan != nullptr ? asan : "") + ":detect_leaks=0"});
        command.insert(command.end(), args.begin(), args.end());
        std::string out, err;
        EXPECT_EQ(0, zepatest::RunProgram(command, &out, &err)) << err;
        return Events(zepatest::ReadFile(log));
    }
    void ExpectDurable(const std::vector<std::string>& events, const std::string& target) const {
        ASSERT_EQ(3u, events.size()) << ::testing::PrintToString(events);
        const std::string tmp = target + ".tmp.";
        EXPECT_EQ(0u, events[0].find("fsync " + tmp)) << events[0];
        const std::string tmpName = events[0].substr(std::string("fsync ").size());
        EXPECT_EQ("rename " + tmpName + " " + target, events[1]);
        EXPECT_EQ("fsync " + folder, events[2]);
    }
    std::string folder;
};

TEST_F(DurableWritesTraced, ConfigurationWriteSyncsFileRenamesAndSyncsFolderEachTime) {
    const std::string target = folder + "/zeparelayd.conf";
    for (const char* value : {"first", "second"}) {
        SCOPED_TRACE(value);
        ExpectDurable(Trace({target, value}), target);
        EXPECT_EQ(value, zepatest::ParseJson(zepatest::ReadFile(target))["value"].asString());
    }
}

TEST_F(DurableWritesTraced, KeyValueWriteSyncsFileRenamesAndSyncsFolderEachTime) {
    const std::string target = folder + "/zepainfo.conf";
    zepatest::WriteFile(target, "runrelayd=\"no\"\n");
    for (const char* value : {"yes", "no"}) {
        SCOPED_TRACE(value);
        ExpectDurable(Trace({"--kv", target, "runrelayd", value}), target);
        EXPECT_EQ("runrelayd=\"" + std::string(value) + "\"\n", zepatest::ReadFile(target));
    }
}

}  // namespace
