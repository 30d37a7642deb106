// Audio settings: the OSS mixer through a stand-in sound card (highest
// numbered mixer first, PCM channel first), the saved volume and equalizer
// profile lookup.
#include <gtest/gtest.h>

#include <cerrno>
#include <fcntl.h>
#include <linux/soundcard.h>
#include <map>
#include <string>
#include <vector>

#include "audio/info.h"
#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"

namespace {

// Mixer devices of the stand-in card by path: channel mask and levels.
struct FakeMixer {
    int mask = 0;
    int levels[SOUND_MIXER_NRDEVICES] = {};
    std::vector<int> written;
};
std::map<std::string, FakeMixer> g_mixers;
std::map<int, std::string> g_open;
std::vector<std::string> g_attempts;

int FakeOpen(const char *path, int)
{
    g_attempts.push_back(path);
    if (!g_mixers.count(path))
        return errno = ENOENT, -1;
    int fd = 100 + static_cast<int>(g_attempts.size());
    g_open[fd] = path;
    return fd;
}

int FakeClose(int fd)
{
    return g_open.erase(fd) ? 0 : (errno = EBADF, -1);
}

int FakeIoctl(int fd, unsigned long request, void *arg)
{
    FakeMixer &m = g_mixers[g_open.at(fd)];
    int *value = static_cast<int *>(arg);
    if (request == SOUND_MIXER_READ_DEVMASK)
        return *value = m.mask, 0;
    for (int ch = 0; ch < SOUND_MIXER_NRDEVICES; ++ch) {
        bool read = request == static_cast<unsigned long>(MIXER_READ(ch));
        if (!read && request != static_cast<unsigned long>(MIXER_WRITE(ch)))
            continue;
        if (!(m.mask & (1 << ch)))
            return errno = EINVAL, -1;
        if (read)
            return *value = m.levels[ch], 0;
        m.written.push_back(ch);
        return m.levels[ch] = *value, 0;
    }
    return errno = ENOTTY, -1;
}

const int kPcm = 1 << SOUND_MIXER_PCM, kVolume = 1 << SOUND_MIXER_VOLUME, kLine = 1 << SOUND_MIXER_LINE;

TEST(Mixer, HighestMixerAndPcmChannelFirst)
{
    tarntest::Harness h;
    MixerOps ops = {FakeOpen, FakeIoctl, FakeClose};
    MixerSetOps(&ops);
    auto mixer = [&](int n) { return h.Path("/dev/mixer") + (n ? std::to_string(n) : ""); };
    EXPECT_EQ(-1, MixerFindDevice(nullptr, 0, nullptr, 0));
    EXPECT_EQ(mixer(7), g_attempts.front());
    EXPECT_EQ(mixer(0), g_attempts.back());
    g_mixers[mixer(0)].mask = kPcm;
    g_mixers[mixer(2)].mask = kLine | (1 << SOUND_MIXER_CD);
    FakeMixer &m = g_mixers[mixer(5)];
    m.mask = kVolume | kPcm | kLine;
    char dev[256], dsp[256];
    EXPECT_EQ(5, MixerFindDevice(dev, sizeof(dev), dsp, sizeof(dsp)));
    EXPECT_EQ(mixer(5), dev);
    EXPECT_EQ(h.Path("/dev/dsp5"), dsp);

    m.levels[SOUND_MIXER_VOLUME] = 10 | (10 << 8);
    // PCM, mean of left and right rounded down, capped at 100, upper bits ignored.
    for (auto c : std::vector<std::pair<int, int>>{{80 | (81 << 8), 80}, {0xff | (0xff << 8), 100},
                                                   {40 | (60 << 8) | (0x7f << 16), 50}}) {
        m.levels[SOUND_MIXER_PCM] = c.first;
        EXPECT_EQ(c.second, MixerGetVolume());
    }
    ASSERT_EQ(0, MixerSetVolume(5, 150));
    EXPECT_EQ(100 * 257, m.levels[SOUND_MIXER_PCM]);
    EXPECT_EQ(10 | (10 << 8), m.levels[SOUND_MIXER_VOLUME]);
    // Without PCM the lowest channel is used.
    ASSERT_EQ(0, MixerSetVolume(2, -5));
    EXPECT_EQ(std::vector<int>{SOUND_MIXER_LINE}, g_mixers[mixer(2)].written);
    EXPECT_EQ(-1, MixerSetVolume(3, 50));
    ASSERT_EQ(0, MixerSetVolumeAll(30));
    EXPECT_EQ(30 * 257, g_mixers[mixer(0)].levels[SOUND_MIXER_PCM]);
    EXPECT_TRUE(g_open.empty()) << "no descriptor is kept";

    // The saved volume: clamped, other settings kept, applied to the mixer.
    EXPECT_EQ(-1, VolumeConfGet());
    ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "admin_port=8080\naudio_volume=250\n"));
    EXPECT_EQ(250, VolumeConfGet());
    ASSERT_EQ(0, VolumeConfSet(150));
    EXPECT_EQ("admin_port=8080\naudio_volume=\"100\"\n", h.ReadFile(TARN_INFO_CONF));
    ASSERT_EQ(0, VolumeConfSet(42));
    ASSERT_EQ(0, VolumeApplySaved());
    EXPECT_EQ(42 * 257, m.levels[SOUND_MIXER_PCM]);
    ASSERT_EQ(0, h.WriteFile(TARN_PROC_VOLUME, "0000012345\n"));  // at most seven characters
    ASSERT_EQ(0, VolumeSyncFromProc());
    EXPECT_EQ(12, VolumeConfGet());
    MixerSetOps(nullptr);
    g_mixers.clear();
}

TEST(EqProfiles, PrefixMatchFirstLineWinsAndDefaultProfile)
{
    tarntest::Harness h;
    const std::string a = "1.0 2.0 3.0 4.0 5.0 6.0 7.0 8.0 9.0 10.0", b = "-1.0 -2.0 -3.0 -4.0 -5.0 -6.0 -7.0 -8.0 -9.0 -10.0";
    ASSERT_EQ(0, h.WriteFile("/tmp/p", "Ro:" + b + "\nJazz: \t" + a + "  \r\nLive: Club:" + a + "\nbroken\n"));
    std::string path = h.Path("/tmp/p");
    auto look = [&](const char *name) {
        char out[256];
        int rc = EqProfileLookup(path.c_str(), name, out, sizeof(out));
        return std::to_string(rc) + (rc == 1 ? ":" + std::string(out) : "");
    };
    // The line's name is a prefix of the wanted one; the last colon separates.
    EXPECT_EQ("1:" + b, look("Rock"));
    EXPECT_EQ("1:" + a, look("Jazz"));
    EXPECT_EQ("1:" + a, look("Live: Club"));
    EXPECT_EQ("-1", look("Jaz")) << "no line matched before the illegal one";
    EXPECT_EQ(1, h.CountLog("ctrl:529 The EQ profile [broken] is illegal."));

    ASSERT_EQ(0, h.WriteFile(TARN_EQ_SYSTEM_FILE, "Jazz:" + a + "\n"));
    ASSERT_EQ(0, h.WriteFile(TARN_EQ_USER_FILE, "Jazz:" + b + "\nMine:" + b + "\n"));
    char out[256];
    for (auto c : std::vector<std::pair<std::string, std::string>>{
             {"audio_default_equalizer=Jazz\n", "0"}, {"audio_enable_equalizer=Yes\naudio_default_equalizer=Jazz\n", "0"},
             {"audio_enable_equalizer=\"yes\"\naudio_default_equalizer=\"Jazz\"\n", "1:" + a},
             {"audio_enable_equalizer=yes\naudio_default_equalizer=Mine\n", "1:" + b}}) {
        ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, c.first));
        int rc = EqDefaultProfileGet(out, sizeof(out));
        EXPECT_EQ(c.second, std::to_string(rc) + (rc == 1 ? ":" + std::string(out) : "")) << c.first;
    }
}

}  // namespace
