#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>
#include <zepasdk/kv.h>
#include <zepasdk/sysroot.h>

#include <cstring>
#include <string>
#include <vector>

#include "support/test_support.h"

using zepatest::FileMode;
using zepatest::ReadFile;
using zepatest::RootTest;
using zepatest::WriteFile;

namespace {

class KvTest : public RootTest {
protected:
    std::string file(const std::string& content) {
        root.write("/etc/test.conf", content);
        return root.path("/etc/test.conf");
    }
    std::string get(const std::string& path, const char* key, int size = 256) {
        char buf[256];
        memset(buf, 'x', sizeof(buf));
        last = VLIBCFileGetKeyValue(path.c_str(), key, buf, size);
        return buf;
    }
    int last = 0;
};

TEST_F(KvTest, ReadsQuotedAndUnquotedValues) {
    std::string f = file("a=\"1\"\nb = \"two words\"  \n  c=plain text \nd=\"\"\n");
    EXPECT_EQ("1", get(f, "a"));
    EXPECT_EQ(1, last);
    EXPECT_EQ("two words", get(f, "b"));
    EXPECT_EQ(9, last);
    EXPECT_EQ("plain text", get(f, "c"));
    EXPECT_EQ("", get(f, "d"));
    EXPECT_EQ(0, last);
    EXPECT_EQ(ZEPA_ERR_NONE, VLIBCErrGet());
}

TEST_F(KvTest, EscapedQuotesAndBackslashes) {
    std::string f = file("k=\"say \\\"hi\\\" \\\\ there\"\n");
    EXPECT_EQ("say \"hi\" \\ there", get(f, "k"));
}

TEST_F(KvTest, MissingKeyIsZeroWithKeyNotFound) {
    std::string f = file("a=\"1\"\n");
    EXPECT_EQ("", get(f, "nope"));
    EXPECT_EQ(0, last);
    EXPECT_EQ(ZEPA_ERR_KEY_NOT_FOUND, VLIBCErrGet());
}

TEST_F(KvTest, MissingFileIsNegativeWithFileNotFound) {
    EXPECT_EQ("", get(root.path("/etc/absent.conf"), "a"));
    EXPECT_EQ(-1, last);
    EXPECT_EQ(ZEPA_ERR_FILE_NOT_FOUND, VLIBCErrGet());
}

TEST_F(KvTest, MalformedLinesAreSkipped) {
    std::string f =
        file("no equals sign\n=\"empty key\"\nbad=\"unterminated\nok=\"fine\"\n# c=\"1\"\n; d=\"2\"\n\n");
    EXPECT_EQ("fine", get(f, "ok"));
    EXPECT_EQ(0, get(f, "bad").size());
    EXPECT_EQ(0, last);
    EXPECT_EQ(0, get(f, "c").size());
    EXPECT_EQ(0, last);
}

TEST_F(KvTest, FirstOccurrenceWins) {
    std::string f = file("a=\"first\"\na=\"second\"\n");
    EXPECT_EQ("first", get(f, "a"));
}

TEST_F(KvTest, LongValueIsCutToBuffer) {
    std::string f = file("a=\"abcdefghij\"\n");
    EXPECT_EQ("abc", get(f, "a", 4));
    EXPECT_EQ(3, last);
}

TEST_F(KvTest, BadArguments) {
    char buf[8];
    EXPECT_EQ(-1, VLIBCFileGetKeyValue(nullptr, "a", buf, sizeof(buf)));
    EXPECT_EQ(ZEPA_ERR_BAD_PARAMETERS, VLIBCErrGet());
    EXPECT_EQ(-1, VLIBCFileGetKeyValue("/x", "a", buf, 0));
    EXPECT_EQ(-1, VLIBCFileCheckKeyValue(nullptr, "a", "b", 0));
    EXPECT_EQ(-1, VLIBCFileSetKeyValue("/x", "", "v"));
    EXPECT_EQ(-1, VLIBCFileSetKeyValue("/x", "a=b", "v"));
    EXPECT_EQ(-1, VLIBCFileSetKeyValue("/x", "a", "line\nbreak"));
}

TEST_F(KvTest, TopLevelKeysIgnoreSectionedOnes) {
    std::string f = file("top=\"1\"\n[sec]\ninner=\"2\"\n");
    EXPECT_EQ("1", get(f, "top"));
    EXPECT_EQ("", get(f, "inner"));
    EXPECT_EQ(0, last);
}

TEST_F(KvTest, CheckKeyValueComparesWithoutCase) {
    std::string f = file("runHTTPS=\"YES\"\nredirect=\"no\"\n");
    EXPECT_EQ(1, VLIBCFileCheckKeyValue(f.c_str(), "runHTTPS", "yes", 0));
    EXPECT_EQ(0, VLIBCFileCheckKeyValue(f.c_str(), "redirect", "yes", 0));
    EXPECT_EQ(0, VLIBCFileCheckKeyValue(f.c_str(), "missing", "yes", 0));
    // Option 1: the value is the key's default when the key is absent.
    EXPECT_EQ(1, VLIBCFileCheckKeyValue(f.c_str(), "missing", "no", 1));
    EXPECT_EQ(0, VLIBCFileCheckKeyValue(f.c_str(), "redirect", "yes", 1));
    std::string absent = root.path("/etc/none.conf");
    EXPECT_EQ(0, VLIBCFileCheckKeyValue(absent.c_str(), "k", "v", 0));
    EXPECT_EQ(1, VLIBCFileCheckKeyValue(absent.c_str(), "k", "v", 1));
}

TEST_F(KvTest, SetReplacesInPlaceAndKeepsOtherLines) {
    std::string f = file("# header\na=\"1\"\ngarbage line\nb=\"2\"\n");
    chmod(f.c_str(), 0640);
    ASSERT_EQ(0, VLIBCFileSetKeyValue(f.c_str(), "a", "new \"q\""));
    EXPECT_EQ("# header\na=\"new \\\"q\\\"\"\ngarbage line\nb=\"2\"\n", ReadFile(f));
    EXPECT_EQ("new \"q\"", get(f, "a"));
    EXPECT_EQ(0640u, FileMode(f));
}

TEST_F(KvTest, SetAddsMissingKeyBeforeFirstSection) {
    std::string f = file("a=\"1\"\n\n[s]\nx=\"y\"\n");
    ASSERT_EQ(0, VLIBCFileSetKeyValue(f.c_str(), "b", "2"));
    EXPECT_EQ("a=\"1\"\nb=\"2\"\n\n[s]\nx=\"y\"\n", ReadFile(f));
}

TEST_F(KvTest, SetCreatesMissingFile) {
    root.mkdir("/etc");
    std::string f = root.path("/etc/new.conf");
    ASSERT_EQ(0, VLIBCFileSetKeyValue(f.c_str(), "k", "v"));
    EXPECT_EQ("k=\"v\"\n", ReadFile(f));
    EXPECT_EQ(0644u, FileMode(f));
}

TEST_F(KvTest, SetInMissingDirectoryFails) {
    std::string f = root.path("/no/such/dir/x.conf");
    EXPECT_EQ(-1, VLIBCFileSetKeyValue(f.c_str(), "k", "v"));
    EXPECT_EQ(ZEPA_ERR_IO, VLIBCErrGet());
    EXPECT_FALSE(zepatest::FileExists(f));
}

TEST_F(KvTest, InfoSetWritesMainFileUnderRoot) {
    root.write("/etc/zepainfo.conf", "runrelayd=\"no\"\n");
    ASSERT_EQ(0, VLIBCINFOSetKeyValue("runrelayd", "yes"));
    EXPECT_EQ("runrelayd=\"yes\"\n", root.read("/etc/zepainfo.conf"));
}

TEST_F(KvTest, SectionsAreEnumeratedInOrder) {
    std::string f = file("top=\"1\"\n[rule1]\ns_port=\"5000\"\n[ rule 2 ]\n[broken\n[rule3]\n");
    PVLIBCSzList list = VLIBCSzListAlloc(1);
    ASSERT_NE(nullptr, list);
    EXPECT_EQ(3, VLIBCFileEnumSection(f.c_str(), &list));
    ASSERT_EQ(3, list->nItem);
    EXPECT_STREQ("rule1", VLIBCSzListGet(list, 0));
    EXPECT_STREQ("rule 2", VLIBCSzListGet(list, 1));
    EXPECT_STREQ("rule3", VLIBCSzListGet(list, 2));
    EXPECT_EQ(nullptr, VLIBCSzListGet(list, 3));
    VLIBCSzListFree(list);
}

TEST_F(KvTest, EnumSectionOfMissingFileFails) {
    PVLIBCSzList list = VLIBCSzListAlloc(4);
    std::string f = root.path("/etc/none.conf");
    EXPECT_EQ(-1, VLIBCFileEnumSection(f.c_str(), &list));
    EXPECT_EQ(0, list->nItem);
    VLIBCSzListFree(list);
}

TEST_F(KvTest, SectionValues) {
    std::string f = file("[r1]\nprotocol name=\"tcp\"\nenabled=\"1\"\n[r2]\nenabled=\"0\"\n");
    char buf[8];
    EXPECT_EQ(3, VLIBCFileGetSectionValue(f.c_str(), "r1", "protocol name", buf, sizeof(buf)));
    EXPECT_STREQ("tcp", buf);
    EXPECT_EQ(1, VLIBCFileGetSectionValue(f.c_str(), "r2", "enabled", buf, sizeof(buf)));
    EXPECT_STREQ("0", buf);
    EXPECT_EQ(0, VLIBCFileGetSectionValue(f.c_str(), "r2", "protocol name", buf, sizeof(buf)));
    EXPECT_EQ(-1, VLIBCFileGetSectionValue(f.c_str(), "r9", "enabled", buf, sizeof(buf)));
    EXPECT_EQ(ZEPA_ERR_SECTION_NOT_FOUND, VLIBCErrGet());
}

TEST_F(KvTest, SetSectionValueAddsAndReplaces) {
    std::string f = file("[r1]\na=\"1\"\n\n[r2]\nb=\"2\"\n");
    ASSERT_EQ(0, VLIBCFileSetSectionValue(f.c_str(), "r1", "c", "3"));
    ASSERT_EQ(0, VLIBCFileSetSectionValue(f.c_str(), "r2", "b", "22"));
    ASSERT_EQ(0, VLIBCFileSetSectionValue(f.c_str(), "r3", "d", "4"));
    EXPECT_EQ("[r1]\na=\"1\"\nc=\"3\"\n\n[r2]\nb=\"22\"\n[r3]\nd=\"4\"\n", ReadFile(f));
}

TEST_F(KvTest, WriteLeavesNoTemporaryFile) {
    std::string f = file("a=\"1\"\n");
    ASSERT_EQ(0, VLIBCFileSetKeyValue(f.c_str(), "a", "2"));
    std::string listing;
    FILE* p = popen(("ls -a '" + root.path("/etc") + "'").c_str(), "r");
    char line[256];
    while (fgets(line, sizeof(line), p)) listing += line;
    pclose(p);
    EXPECT_EQ(".\n..\ntest.conf\n", listing);
}

TEST_F(KvTest, WriteGoesThroughNothingPlantedAtTheTemporaryName) {
    std::string f = file("runrelayd=\"no\"\n");
    root.write("/etc/victim", "secret", 0600);
    const std::string tmp = f + ".tmp." + std::to_string(getpid());
    const std::vector<std::string> kinds = {"link", "fifo", "folder", "second-link", "stale"};
    for (const std::string& kind : kinds) {
        SCOPED_TRACE(kind);
        if (kind == "link") {
            ASSERT_EQ(0, symlink(root.path("/etc/victim").c_str(), tmp.c_str()));
        } else if (kind == "fifo") {
            ASSERT_EQ(0, mkfifo(tmp.c_str(), 0666));
        } else if (kind == "folder") {
            ASSERT_EQ(0, mkdir(tmp.c_str(), 0755));
        } else if (kind == "second-link") {
            ASSERT_EQ(0, link(root.path("/etc/victim").c_str(), tmp.c_str()));
        } else {
            // A leftover of an earlier write of ours, longer than the new text.
            WriteFile(tmp, std::string(4000, 'x'), 0600);
        }
        ASSERT_EQ(0, VLIBCFileSetKeyValue(f.c_str(), "runrelayd", kind.c_str()));
        EXPECT_EQ("runrelayd=\"" + kind + "\"\n", ReadFile(f));
        EXPECT_EQ(0644u, FileMode(f));
        EXPECT_FALSE(zepatest::FileExists(tmp));
        EXPECT_EQ("secret", root.read("/etc/victim"));
        EXPECT_EQ(0600u, FileMode(root.path("/etc/victim")));
    }
}

// Parsed files are kept between calls: every kind of rewrite must be seen.
class KvRewriteTest : public KvTest {
protected:
    // Overwrites the file where it is (same inode).
    static void rewriteInPlace(const std::string& path, const std::string& content) {
        int fd = open(path.c_str(), O_WRONLY | O_TRUNC);
        ASSERT_GE(fd, 0);
        ASSERT_EQ(static_cast<ssize_t>(content.size()), write(fd, content.data(), content.size()));
        close(fd);
    }
    // Replaces the file by a new one (new inode), as editors and our writer do.
    static void rewriteByRename(const std::string& path, const std::string& content) {
        WriteFile(path + ".new", content);
        ASSERT_EQ(0, rename((path + ".new").c_str(), path.c_str()));
    }
};

TEST_F(KvRewriteTest, SameSizeRewriteInPlaceIsSeenAtOnce) {
    std::string f = file("k=\"aaa\"\n");
    EXPECT_EQ("aaa", get(f, "k"));
    rewriteInPlace(f, "k=\"bbb\"\n");
    EXPECT_EQ("bbb", get(f, "k"));
    rewriteInPlace(f, "k=\"ccc\"\n");
    EXPECT_EQ("ccc", get(f, "k"));
}

TEST_F(KvRewriteTest, SameSizeRewriteInPlaceWithOldTimeRestoredIsSeen) {
    std::string f = file("k=\"aaa\"\n");
    struct timespec old[2] = {{1000000000, 0}, {1000000000, 0}};
    ASSERT_EQ(0, utimensat(AT_FDCWD, f.c_str(), old, 0));
    EXPECT_EQ("aaa", get(f, "k"));
    rewriteInPlace(f, "k=\"bbb\"\n");
    ASSERT_EQ(0, utimensat(AT_FDCWD, f.c_str(), old, 0));
    EXPECT_EQ("bbb", get(f, "k"));
}

TEST_F(KvRewriteTest, ReplacementByRenameIsSeen) {
    std::string f = file("k=\"aaa\"\n");
    EXPECT_EQ("aaa", get(f, "k"));
    rewriteByRename(f, "k=\"bbb\"\n");
    EXPECT_EQ("bbb", get(f, "k"));
}

TEST_F(KvRewriteTest, GrownFileShowsNewSectionsAndKeys) {
    std::string f = file("[r1]\ns_port=\"1\"\n");
    PVLIBCSzList list = VLIBCSzListAlloc(4);
    ASSERT_NE(nullptr, list);
    EXPECT_EQ(1, VLIBCFileEnumSection(f.c_str(), &list));
    VLIBCSzListFree(list);
    char buf[16];
    EXPECT_EQ(-1, VLIBCFileGetSectionValue(f.c_str(), "r2", "s_port", buf, sizeof(buf)));

    WriteFile(f, "[r1]\ns_port=\"1\"\n[r2]\ns_port=\"22\"\n");
    list = VLIBCSzListAlloc(4);
    ASSERT_NE(nullptr, list);
    EXPECT_EQ(2, VLIBCFileEnumSection(f.c_str(), &list));
    VLIBCSzListFree(list);
    EXPECT_EQ(2, VLIBCFileGetSectionValue(f.c_str(), "r2", "s_port", buf, sizeof(buf)));
    EXPECT_STREQ("22", buf);
}

TEST_F(KvRewriteTest, RemovedFileIsMissingAndRecreatedOneIsRead) {
    std::string f = file("k=\"aaa\"\n");
    EXPECT_EQ("aaa", get(f, "k"));
    ASSERT_EQ(0, unlink(f.c_str()));
    get(f, "k");
    EXPECT_EQ(-1, last);
    EXPECT_EQ(ZEPA_ERR_FILE_NOT_FOUND, VLIBCErrGet());
    EXPECT_EQ(0, VLIBCFileCheckKeyValue(f.c_str(), "k", "aaa", 0));
    WriteFile(f, "k=\"ddd\"\n");
    EXPECT_EQ("ddd", get(f, "k"));
    EXPECT_EQ(1, VLIBCFileCheckKeyValue(f.c_str(), "k", "ddd", 0));
}

TEST_F(KvRewriteTest, OwnWriteIsSeenByTheNextRead) {
    std::string f = file("k=\"aaa\"\n");
    EXPECT_EQ("aaa", get(f, "k"));
    ASSERT_EQ(0, VLIBCFileSetKeyValue(f.c_str(), "k", "bbb"));
    EXPECT_EQ("bbb", get(f, "k"));
    EXPECT_EQ(1, VLIBCFileCheckKeyValue(f.c_str(), "k", "BBB", 0));
}

TEST_F(KvRewriteTest, ManyFilesReadInTurnKeepTheirOwnValues) {
    const int kFiles = 80;
    for (int round = 0; round < 2; ++round) {
        for (int i = 0; i < kFiles; ++i) {
            std::string name = "/etc/many" + std::to_string(i) + ".conf";
            if (round == 0) root.write(name, "k=\"" + std::to_string(i) + "\"\n");
            EXPECT_EQ(std::to_string(i), get(root.path(name), "k"));
        }
    }
}

TEST_F(KvRewriteTest, FileReplacedByFifoIsRefusedWithoutBlocking) {
    std::string f = file("k=\"aaa\"\n");
    EXPECT_EQ("aaa", get(f, "k"));
    ASSERT_EQ(0, unlink(f.c_str()));
    ASSERT_EQ(0, mkfifo(f.c_str(), 0644));
    get(f, "k");
    EXPECT_EQ(-1, last);
    EXPECT_EQ(ZEPA_ERR_FILE_NOT_FOUND, VLIBCErrGet());
}

TEST(SzList, GrowsBeyondItsCapacity) {
    PVLIBCSzList list = VLIBCSzListAlloc(0);
    ASSERT_NE(nullptr, list);
    for (int i = 0; i < 100; ++i) ASSERT_EQ(0, VLIBCSzListPush(&list, std::to_string(i).c_str()));
    EXPECT_EQ(100, list->nItem);
    EXPECT_STREQ("99", VLIBCSzListGet(list, 99));
    EXPECT_EQ(-1, VLIBCSzListPush(&list, nullptr));
    VLIBCSzListFree(list);
    VLIBCSzListFree(nullptr);
}

TEST(SysRoot, DefaultRootLeavesPathsUnchanged) {
    ZEPASysRootSet(nullptr);
    char buf[64];
    EXPECT_STREQ("/", ZEPASysRootGet());
    EXPECT_EQ(18, ZEPASysRootPath("/etc/zepainfo.conf", buf, sizeof(buf)));
    EXPECT_STREQ("/etc/zepainfo.conf", buf);
}

TEST(SysRoot, RootIsPrefixedAndTrailingSlashDropped) {
    ASSERT_EQ(0, ZEPASysRootSet("/stage/"));
    char buf[64];
    EXPECT_GT(ZEPASysRootPath("/etc/x", buf, sizeof(buf)), 0);
    EXPECT_STREQ("/stage/etc/x", buf);
    EXPECT_EQ(-1, ZEPASysRootSet("relative"));
    EXPECT_STREQ("/stage", ZEPASysRootGet());
    EXPECT_EQ(-1, ZEPASysRootPath("etc/x", buf, sizeof(buf)));
    EXPECT_EQ(-1, ZEPASysRootPath("/etc/x", buf, 5));
    EXPECT_STREQ("", buf);
    ZEPASysRootSet("/");
}

class ExecTest : public RootTest {};

TEST_F(ExecTest, RunsProgramWithArgumentsAndReturnsStatus) {
    root.write("/bin/rec", "#!/bin/sh\nprintf '%s|' \"$0\" \"$@\" > \"$(dirname \"$0\")/args\"\nexit 3\n",
               0755);
    std::string prog = root.path("/bin/rec");
    EXPECT_EQ(3, VLIBCExec(prog.c_str(), "one", "two words", nullptr));
    EXPECT_EQ(prog + "|one|two words|", root.read("/bin/args"));
}

TEST_F(ExecTest, MissingProgramIsMinusOne) {
    std::string prog = root.path("/bin/absent");
    EXPECT_EQ(-1, VLIBCExec(prog.c_str(), "x", nullptr));
    EXPECT_EQ(ZEPA_ERR_EXEC, VLIBCErrGet());
    EXPECT_EQ(-1, VLIBCExec(nullptr, nullptr));
}

TEST_F(ExecTest, KilledProgramReportsSignal) {
    root.write("/bin/die", "#!/bin/sh\nkill -TERM $$\n", 0755);
    EXPECT_EQ(128 + 15, VLIBCExec(root.path("/bin/die").c_str(), nullptr));
}

}  // namespace
