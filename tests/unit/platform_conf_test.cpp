// Key=value configuration files, trimming and text lists.
#include <gtest/gtest.h>

#include <cstdlib>
#include <dirent.h>
#include <fstream>
#include <sstream>
#include <string>
#include <csignal>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/tlibc_conf.h"

namespace {

class ConfFileTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        char tmpl[] = "/tmp/tarn_conf_test.XXXXXX";
        ASSERT_NE(nullptr, mkdtemp(tmpl));
        dir = tmpl;
        file = dir + "/etc/tarninfo.conf";
    }
    void TearDown() override
    {
        std::string cmd = "rm -rf '" + dir + "'";
        ASSERT_EQ(0, system(cmd.c_str()));
    }
    void Write(const std::string &text)
    {
        mkdir((dir + "/etc").c_str(), 0755);
        std::ofstream(file) << text;
    }
    std::string Read()
    {
        std::ifstream in(file);
        std::stringstream ss;
        ss << in.rdbuf();
        return ss.str();
    }
    // Names in the directory of the file (to see leftovers of a write).
    std::vector<std::string> DirEntries()
    {
        std::vector<std::string> names;
        DIR *d = opendir((dir + "/etc").c_str());
        if (!d)
            return names;
        while (struct dirent *e = readdir(d)) {
            std::string n = e->d_name;
            if (n != "." && n != "..")
                names.push_back(n);
        }
        closedir(d);
        return names;
    }
    std::string dir;
    std::string file;
};

TEST_F(ConfFileTest, ReadsPlainAndQuotedValues)
{
    Write("# appliance settings\n"
          "admin_port=8080\n"
          "  audio_volume = \"42\"  \n"
          "audio_enable_equalizer=yes\n"
          "empty=\n"
          "name=\"two words\"\n"
          "broken line without equals\n");
    char buf[64];
    EXPECT_EQ(4, TLIBCFileGetKeyValue(file.c_str(), "admin_port", buf, sizeof(buf), 0));
    EXPECT_STREQ("8080", buf);
    EXPECT_EQ(2, TLIBCFileGetKeyValue(file.c_str(), "audio_volume", buf, sizeof(buf), 0));
    EXPECT_STREQ("42", buf);
    EXPECT_EQ(9, TLIBCFileGetKeyValue(file.c_str(), "name", buf, sizeof(buf), 0));
    EXPECT_STREQ("two words", buf);
    EXPECT_EQ(0, TLIBCFileGetKeyValue(file.c_str(), "empty", buf, sizeof(buf), 0));
    EXPECT_EQ(0, TLIBCFileGetKeyValue(file.c_str(), "missing", buf, sizeof(buf), 0));
    EXPECT_STREQ("", buf);
    // A key is matched whole, not as a prefix.
    EXPECT_EQ(0, TLIBCFileGetKeyValue(file.c_str(), "audio", buf, sizeof(buf), 0));
}

TEST_F(ConfFileTest, ReadTruncatesToBufferAndRejectsBadArguments)
{
    Write("audio_volume=1234567890\n");
    char buf[8];
    EXPECT_EQ(7, TLIBCFileGetKeyValue(file.c_str(), "audio_volume", buf, sizeof(buf), 0));
    EXPECT_STREQ("1234567", buf);
    EXPECT_GT(1, TLIBCFileGetKeyValue((dir + "/nofile").c_str(), "audio_volume", buf, sizeof(buf), 0));
    EXPECT_EQ(-1, TLIBCFileGetKeyValue(nullptr, "k", buf, sizeof(buf), 0));
    EXPECT_EQ(-1, TLIBCFileGetKeyValue(file.c_str(), nullptr, buf, sizeof(buf), 0));
    EXPECT_EQ(-1, TLIBCFileGetKeyValue(file.c_str(), "k", nullptr, 8, 0));
    EXPECT_EQ(-1, TLIBCFileGetKeyValue(file.c_str(), "k", buf, 0, 0));
}

TEST_F(ConfFileTest, WriteCreatesFileAndParents)
{
    ASSERT_EQ(0, TLIBCFileSetKeyValue(file.c_str(), "audio_volume", "55", "%s=\"%s\"\n"));
    EXPECT_EQ("audio_volume=\"55\"\n", Read());
    char buf[8];
    EXPECT_EQ(2, TLIBCFileGetKeyValue(file.c_str(), "audio_volume", buf, sizeof(buf), 0));
    EXPECT_STREQ("55", buf);
    struct stat st;
    ASSERT_EQ(0, stat(file.c_str(), &st));
    EXPECT_EQ(0644u, st.st_mode & 0777);
}

TEST_F(ConfFileTest, WriteReplacesKeyInPlaceAndKeepsOtherLines)
{
    Write("# comment\nadmin_port=8080\naudio_volume=10\nother=x\naudio_volume=20\nno_newline=y");
    chmod(file.c_str(), 0600);
    ASSERT_EQ(0, TLIBCFileSetKeyValue(file.c_str(), "audio_volume", "77", "%s=\"%s\"\n"));
    EXPECT_EQ("# comment\nadmin_port=8080\naudio_volume=\"77\"\nother=x\nno_newline=y\n", Read());
    ASSERT_EQ(0, TLIBCFileSetKeyValue(file.c_str(), "new_key", "v", nullptr));
    EXPECT_EQ("# comment\nadmin_port=8080\naudio_volume=\"77\"\nother=x\nno_newline=y\nnew_key=v\n", Read());
    // The file keeps its permissions and no temporary file is left behind.
    struct stat st;
    ASSERT_EQ(0, stat(file.c_str(), &st));
    EXPECT_EQ(0600u, st.st_mode & 0777);
    EXPECT_EQ(std::vector<std::string>{"tarninfo.conf"}, DirEntries());
}

TEST_F(ConfFileTest, RefusedWritesLeaveFileUnchanged)
{
    const std::string before = "audio_volume=10\n";
    Write(before);
    // Values or keys that would break the line structure.
    EXPECT_EQ(-1, TLIBCFileSetKeyValue(file.c_str(), "audio_volume", "1\nadmin_port=1", nullptr));
    EXPECT_EQ(-1, TLIBCFileSetKeyValue(file.c_str(), "a=b", "1", nullptr));
    EXPECT_EQ(-1, TLIBCFileSetKeyValue(file.c_str(), "", "1", nullptr));
    // Formats other than two "%s" conversions.
    EXPECT_EQ(-1, TLIBCFileSetKeyValue(file.c_str(), "audio_volume", "1", "%s=%d\n"));
    EXPECT_EQ(-1, TLIBCFileSetKeyValue(file.c_str(), "audio_volume", "1", "%s\n"));
    EXPECT_EQ(-1, TLIBCFileSetKeyValue(file.c_str(), "audio_volume", "1", "%s=%s%n"));
    EXPECT_EQ(-1, TLIBCFileSetKeyValue(nullptr, "audio_volume", "1", nullptr));
    EXPECT_EQ(before, Read());
    // "%%" is allowed.
    EXPECT_EQ(0, TLIBCFileSetKeyValue(file.c_str(), "p", "5", "%s=%s%%\n"));
    EXPECT_EQ("audio_volume=10\np=5%\n", Read());
}

TEST_F(ConfFileTest, FailedWriteKeepsOldFileAndLeavesNoTemporary)
{
    const std::string before = "admin_port=8080\naudio_volume=10\n";
    Write(before);
    // A file size limit makes the write fail the way a full disk does.
    struct rlimit old;
    ASSERT_EQ(0, getrlimit(RLIMIT_FSIZE, &old));
    sighandler_t oldHandler = signal(SIGXFSZ, SIG_IGN);
    struct rlimit small = old;
    small.rlim_cur = 64;
    ASSERT_EQ(0, setrlimit(RLIMIT_FSIZE, &small));
    std::string big(200, 'x');
    int rc = TLIBCFileSetKeyValue(file.c_str(), "audio_volume", big.c_str(), nullptr);
    setrlimit(RLIMIT_FSIZE, &old);
    signal(SIGXFSZ, oldHandler);
    EXPECT_EQ(-1, rc);
    EXPECT_EQ(before, Read());
    EXPECT_EQ(std::vector<std::string>{"tarninfo.conf"}, DirEntries());

    // A parent that is not a directory.
    std::string blocked = dir + "/etc/tarninfo.conf/inner.conf";
    EXPECT_EQ(-1, TLIBCFileSetKeyValue(blocked.c_str(), "k", "v", nullptr));
    EXPECT_EQ(before, Read());
}

TEST(TrimSpace, TrimsBothEndsInPlace)
{
    char a[] = " \t 0.0 1.5 -2.0 \r\n";
    EXPECT_EQ(12, TLIBCStrTrimSpace(a, 0));
    EXPECT_STREQ("0.0 1.5 -2.0", a);
    char b[] = "   ";
    EXPECT_EQ(0, TLIBCStrTrimSpace(b, 0));
    EXPECT_STREQ("", b);
    char c[] = "x";
    EXPECT_EQ(1, TLIBCStrTrimSpace(c, 0));
    EXPECT_STREQ("x", c);
    EXPECT_LT(TLIBCStrTrimSpace(nullptr, 0), 0);
}

TEST(TextList, SplitsSortsAndGrows)
{
    TLIBC_SZLIST *list = TLIBCSzListAlloc(1);
    ASSERT_NE(nullptr, list);
    EXPECT_EQ(4, TLIBCStrSep("3,,10,1,2,", ",", &list));
    ASSERT_EQ(4, TLIBCSzListCount(list));
    EXPECT_STREQ("3", TLIBCSzListGet(list, 0));
    EXPECT_STREQ("2", TLIBCSzListGet(list, 3));
    EXPECT_EQ(nullptr, TLIBCSzListGet(list, 4));
    EXPECT_EQ(nullptr, TLIBCSzListGet(list, -1));
    ASSERT_EQ(0, TLIBCSzListSortItems(list, 1));
    EXPECT_STREQ("1", TLIBCSzListGet(list, 0));
    EXPECT_STREQ("10", TLIBCSzListGet(list, 1));
    EXPECT_STREQ("2", TLIBCSzListGet(list, 2));
    EXPECT_STREQ("3", TLIBCSzListGet(list, 3));
    ASSERT_EQ(0, TLIBCSzListSortItems(list, 0));
    EXPECT_STREQ("3", TLIBCSzListGet(list, 0));
    EXPECT_EQ(0, TLIBCStrSep("", ",", &list));
    EXPECT_EQ(0, TLIBCStrSep(",,,", ",", &list));
    EXPECT_EQ(4, TLIBCSzListCount(list));
    for (int i = 0; i < 2000; ++i)
        ASSERT_EQ(0, TLIBCSzListAdd(&list, std::to_string(i).c_str()));
    EXPECT_EQ(2004, TLIBCSzListCount(list));
    EXPECT_STREQ("1999", TLIBCSzListGet(list, 2003));
    EXPECT_EQ(-1, TLIBCStrSep(nullptr, ",", &list));
    TLIBCSzListFree(list);
    TLIBCSzListFree(nullptr);
    EXPECT_EQ(nullptr, TLIBCSzListGet(nullptr, 0));
    EXPECT_EQ(-1, TLIBCSzListSortItems(nullptr, 1));
}

}  // namespace
