// Key=value configuration files: reading, replacing in place, and writes
// that fail without touching the old file.
#include <gtest/gtest.h>

#include <csignal>
#include <filesystem>
#include <fstream>
#include <string>
#include <sys/resource.h>

#include "platform/tlibc_conf.h"
#include "tests/harness/harness.h"

namespace {

TEST(ConfFile, ReadReplaceAndFailSafely)
{
    tarntest::Harness h;
    std::string file = h.Path("/etc/tarninfo.conf");
    const std::string before = "# c\nadmin_port=8080\naudio_volume=\"42\"\nname=\"two words\"\naudio_volume=2\nlast=y";
    ASSERT_EQ(0, h.WriteFile("/etc/tarninfo.conf", before));
    char buf[8];
    EXPECT_EQ(2, TLIBCFileGetKeyValue(file.c_str(), "audio_volume", buf, sizeof(buf), 0));
    EXPECT_STREQ("42", buf);
    EXPECT_EQ(7, TLIBCFileGetKeyValue(file.c_str(), "name", buf, sizeof(buf), 0));
    EXPECT_STREQ("two wor", buf);
    EXPECT_EQ(0, TLIBCFileGetKeyValue(file.c_str(), "audio", buf, sizeof(buf), 0)) << "whole keys only";

    // Refused: line breaks in values, bad keys, formats other than two "%s".
    EXPECT_EQ(-1, TLIBCFileSetKeyValue(file.c_str(), "audio_volume", "1\nadmin_port=1", nullptr));
    EXPECT_EQ(-1, TLIBCFileSetKeyValue(file.c_str(), "a=b", "1", nullptr));
    EXPECT_EQ(-1, TLIBCFileSetKeyValue(file.c_str(), "audio_volume", "1", "%s=%s%n"));
    // A file size limit makes the write fail the way a full disk does.
    struct rlimit old, small;
    ASSERT_EQ(0, getrlimit(RLIMIT_FSIZE, &old));
    sighandler_t oldHandler = signal(SIGXFSZ, SIG_IGN);
    small = old;
    small.rlim_cur = 64;
    ASSERT_EQ(0, setrlimit(RLIMIT_FSIZE, &small));
    int rc = TLIBCFileSetKeyValue(file.c_str(), "audio_volume", std::string(200, 'x').c_str(), nullptr);
    setrlimit(RLIMIT_FSIZE, &old);
    signal(SIGXFSZ, oldHandler);
    EXPECT_EQ(-1, rc);
    EXPECT_EQ(before, h.ReadFile("/etc/tarninfo.conf"));
    EXPECT_EQ(1, std::distance(std::filesystem::directory_iterator(h.Path("/etc")), {})) << "no temporary left";

    // Replaced in place (duplicates dropped), other lines kept, new keys appended.
    ASSERT_EQ(0, TLIBCFileSetKeyValue(file.c_str(), "audio_volume", "77", "%s=\"%s\"\n"));
    ASSERT_EQ(0, TLIBCFileSetKeyValue(file.c_str(), "p", "5", "%s=%s%%\n"));
    EXPECT_EQ("# c\nadmin_port=8080\naudio_volume=\"77\"\nname=\"two words\"\nlast=y\np=5%\n",
              h.ReadFile("/etc/tarninfo.conf"));
    EXPECT_EQ(-1, TLIBCFileSetKeyValue((file + "/inner.conf").c_str(), "k", "v", nullptr));
}

}  // namespace
