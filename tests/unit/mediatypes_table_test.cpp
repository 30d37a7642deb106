// File types, MIME types, the USB volume test, the network card and the
// song-id tokens.
#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <fstream>
#include <set>
#include <string>

#include "platform/media_id.h"
#include "platform/tarn_env.h"
#include "platform/tarn_media_types.h"
#include "platform/tarn_net.h"

namespace {

// Every test of this program runs under one private root.
class RootEnv : public ::testing::Environment {
public:
    void SetUp() override
    {
        char tmpl[] = "/tmp/tarn_mediatypes_test.XXXXXX";
        ASSERT_NE(nullptr, mkdtemp(tmpl));
        root = tmpl;
        setenv("TARN_ROOT", root.c_str(), 1);
        ASSERT_EQ(root, TarnRoot());
        mkdir((root + "/etc").c_str(), 0755);
    }
    void TearDown() override
    {
        std::string cmd = "rm -rf '" + root + "'";
        system(cmd.c_str());
    }
    static std::string root;
};
std::string RootEnv::root;
::testing::Environment *const g_env = ::testing::AddGlobalTestEnvironment(new RootEnv);

void WriteConf(const std::string &text)
{
    std::ofstream(RootEnv::root + "/etc/tarninfo.conf") << text;
}

std::string Mime(const char *ext)
{
    char buffer[64];
    if (TARNAudioGetMimetype(ext, buffer, sizeof(buffer)) != 0)
        return "<none>";
    return buffer;
}

TEST(MediaTypes, EveryPlayableTypeHasAudioMimeAndTxtIsText)
{
    const char *playable[] = {"mp3", "m4a", "ogg", "aac", "wma", "flac", "aiff", "aif", "mp1",
                              "mp2", "mpa", "wav", "ac3", "ra", "ram", "m4p", "m4b", "ape"};
    for (const char *ext : playable) {
        std::string m = Mime(ext);
        EXPECT_EQ(0u, m.rfind("audio/", 0)) << ext << " -> " << m;
        std::string upper = ext;
        for (char &c : upper)
            c = static_cast<char>(toupper(c));
        EXPECT_EQ(m, Mime(upper.c_str())) << "case of " << ext;
    }
    EXPECT_EQ("audio/mpeg", Mime("mp3"));
    EXPECT_EQ("audio/flac", Mime("flac"));
    EXPECT_EQ("audio/mp4", Mime("m4a"));
    EXPECT_EQ("audio/wav", Mime("wav"));
    EXPECT_EQ("text/plain", Mime("txt"));
    EXPECT_EQ("<none>", Mime("exe"));
    EXPECT_EQ("<none>", Mime(""));
    EXPECT_EQ("<none>", Mime(nullptr));
}

TEST(MediaTypes, MimeBufferTooSmallFailsWithEmptyText)
{
    char small[6] = "xxxxx";
    EXPECT_EQ(-1, TARNAudioGetMimetype("mp3", small, sizeof(small)));
    EXPECT_STREQ("", small);
    char exact[11];  // "audio/mpeg" + NUL
    EXPECT_EQ(0, TARNAudioGetMimetype("mp3", exact, sizeof(exact)));
    EXPECT_STREQ("audio/mpeg", exact);
    EXPECT_EQ(-1, TARNAudioGetMimetype("mp3", nullptr, 64));
}

TEST(MediaTypes, IndexerExtensionIsLowerCaseKnownTypeOfTheFileName)
{
    EXPECT_STREQ("mp3", TARNIndexExtGet("/music/a/Song.MP3"));
    EXPECT_STREQ("flac", TARNIndexExtGet("/music/x.y/track.flac"));
    EXPECT_STREQ("m4b", TARNIndexExtGet("book.m4b"));
    // Only the file name counts, and the last dot of it.
    EXPECT_EQ(nullptr, TARNIndexExtGet("/music/album.mp3/readme"));
    EXPECT_STREQ("ogg", TARNIndexExtGet("/m/a.mp3.ogg"));
    EXPECT_EQ(nullptr, TARNIndexExtGet("/m/a.mp3.part"));
    EXPECT_EQ(nullptr, TARNIndexExtGet("/m/noext"));
    EXPECT_EQ(nullptr, TARNIndexExtGet("/m/trailingdot."));
    EXPECT_EQ(nullptr, TARNIndexExtGet(nullptr));
}

TEST(MediaTypes, UsbVolumeFollowsTheConfiguredMountRootByComponents)
{
    WriteConf("");
    std::string def = RootEnv::root + "/media/usb";
    EXPECT_EQ(1, TARNAudioIsUSBVolume((def + "/disk1/a.mp3").c_str()));
    EXPECT_EQ(1, TARNAudioIsUSBVolume(def.c_str()));
    EXPECT_EQ(0, TARNAudioIsUSBVolume((def + "x/a.mp3").c_str()));
    EXPECT_EQ(0, TARNAudioIsUSBVolume("/media/usb/a.mp3"));  // outside the root in use

    WriteConf("usb_mount_root=\"/mnt/usb/\"\n");
    EXPECT_EQ(1, TARNAudioIsUSBVolume("/mnt/usb/a.mp3"));
    EXPECT_EQ(0, TARNAudioIsUSBVolume("/mnt/usb2/a.mp3"));
    EXPECT_EQ(0, TARNAudioIsUSBVolume("/mnt/us"));
    EXPECT_EQ(-1, TARNAudioIsUSBVolume(""));
    EXPECT_EQ(-1, TARNAudioIsUSBVolume(nullptr));

    WriteConf("usb_mount_root=/\n");
    EXPECT_EQ(1, TARNAudioIsUSBVolume("/a"));
    EXPECT_EQ(0, TARNAudioIsUSBVolume("relative/a"));
    WriteConf("");
}

TEST(NetCard, ConfiguredAddressOrInterfaceWinsOverTheFirstCard)
{
    TARN_NET_CARD card;
    WriteConf("net_card1_address=10.20.30.40\n");
    EXPECT_EQ(1, TARNNetGetCard1(&card));
    EXPECT_STREQ("10.20.30.40", card.ip);

    WriteConf("net_card1_address=not-an-address\n");
    EXPECT_EQ(-1, TARNNetGetCard1(&card));

    WriteConf("net_card1_ifname=lo\n");
    EXPECT_EQ(1, TARNNetGetCard1(&card));
    EXPECT_STREQ("127.0.0.1", card.ip);
    EXPECT_STREQ("lo", card.name);

    WriteConf("net_card1_ifname=nosuchif0\n");
    EXPECT_EQ(0, TARNNetGetCard1(&card));

    // Without configuration: never the loopback.
    WriteConf("");
    int r = TARNNetGetCard1(&card);
    ASSERT_GE(r, 0);
    if (r == 1) {
        EXPECT_STRNE("lo", card.name);
        EXPECT_NE(0, strncmp(card.ip, "127.", 4));
    }
    EXPECT_EQ(-1, TARNNetGetCard1(nullptr));
}

TEST(SongToken, RoundTripsEveryIdAndHidesIt)
{
    const uint32_t ids[] = {0u, 1u, 2u, 255u, 256u, 65535u, 123456789u, 0xFFFFFFFFu};
    std::set<std::string> seen;
    for (uint32_t id : ids) {
        char token[MEDIA_ID_TOKEN_LEN + 1];
        ASSERT_EQ(0, MediaIDEncryption(id, token, sizeof(token)));
        EXPECT_EQ(static_cast<size_t>(MEDIA_ID_TOKEN_LEN), strlen(token));
        EXPECT_EQ(std::string::npos, std::string(token).find_first_not_of("0123456789abcdef"));
        EXPECT_TRUE(seen.insert(token).second) << "two ids share token " << token;
        EXPECT_EQ(token, MediaIDEncryption(id));  // stable
        uint32_t back = 0xdeadbeef;
        ASSERT_EQ(0, MediaIDDecryption(token, &back));
        EXPECT_EQ(id, back);
        // Upper-case hex is the same token.
        std::string upper = token;
        for (char &c : upper)
            c = static_cast<char>(toupper(c));
        back = 0;
        EXPECT_EQ(0, MediaIDDecryption(upper.c_str(), &back));
        EXPECT_EQ(id, back);
    }
    // The id does not show through: tokens of neighbouring ids differ in
    // many digits.
    std::string a = MediaIDEncryption(1000), b = MediaIDEncryption(1001);
    int differ = 0;
    for (size_t i = 0; i < a.size(); ++i)
        differ += a[i] != b[i];
    EXPECT_GT(differ, 16);
}

TEST(SongToken, AlteredOrMadeUpTokensAreRefused)
{
    std::string token = MediaIDEncryption(4242);
    ASSERT_EQ(static_cast<size_t>(MEDIA_ID_TOKEN_LEN), token.size());
    uint32_t id = 0;
    for (size_t i = 0; i < token.size(); ++i) {
        std::string t = token;
        t[i] = t[i] == '0' ? '1' : '0';
        EXPECT_EQ(-1, MediaIDDecryption(t.c_str(), &id)) << "digit " << i;
    }
    EXPECT_EQ(-1, MediaIDDecryption(token.substr(1).c_str(), &id));
    EXPECT_EQ(-1, MediaIDDecryption((token + "0").c_str(), &id));
    EXPECT_EQ(-1, MediaIDDecryption(std::string(32, '0').c_str(), &id));
    EXPECT_EQ(-1, MediaIDDecryption(("zz" + token.substr(2)).c_str(), &id));
    EXPECT_EQ(-1, MediaIDDecryption("", &id));
    EXPECT_EQ(-1, MediaIDDecryption(nullptr, &id));
    EXPECT_EQ(-1, MediaIDDecryption(token.c_str(), nullptr));
    char tiny[8];
    EXPECT_EQ(-1, MediaIDEncryption(1, tiny, sizeof(tiny)));
}

TEST(SongToken, SecretIsAPrivateFileOfTheInstallation)
{
    MediaIDEncryption(7);
    struct stat st;
    std::string key = RootEnv::root + "/usr/tarn/etc/media_id.key";
    ASSERT_EQ(0, stat(key.c_str(), &st)) << key;
    EXPECT_EQ(0600, st.st_mode & 0777);
    EXPECT_EQ(16, st.st_size);
}

}  // namespace
