// OSS mixer access (through a stand-in sound card), the saved volume and the
// sound driver's volume entry.
#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <linux/soundcard.h>
#include <map>
#include <memory>
#include <string>
#include <sys/stat.h>
#include <vector>

#include "audio/info.h"
#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"

namespace {

// A stand-in for the sound card's mixer devices, keyed by device path.
struct FakeMixer {
    int mask = 0;
    int levels[SOUND_MIXER_NRDEVICES] = {};
    bool failMask = false;
    bool failRead = false;
    bool failWrite = false;
    std::vector<int> writtenChannels;
};

struct FakeCard {
    std::map<std::string, FakeMixer> mixers;
    std::map<int, std::string> openFds;
    std::vector<std::string> openAttempts;
    int nextFd = 100;
    int wrongFlags = 0;
};

FakeCard *g_card = nullptr;

int FakeOpen(const char *path, int flags)
{
    g_card->openAttempts.push_back(path);
    if ((flags & O_ACCMODE) != O_RDONLY)
        ++g_card->wrongFlags;
    if (!g_card->mixers.count(path)) {
        errno = ENOENT;
        return -1;
    }
    int fd = g_card->nextFd++;
    g_card->openFds[fd] = path;
    return fd;
}

int FakeClose(int fd)
{
    if (!g_card->openFds.erase(fd)) {
        errno = EBADF;
        return -1;
    }
    return 0;
}

int FakeIoctl(int fd, unsigned long request, void *arg)
{
    auto it = g_card->openFds.find(fd);
    if (it == g_card->openFds.end()) {
        errno = EBADF;
        return -1;
    }
    FakeMixer &m = g_card->mixers[it->second];
    int *value = static_cast<int *>(arg);
    if (request == SOUND_MIXER_READ_DEVMASK) {
        if (m.failMask) {
            errno = EIO;
            return -1;
        }
        *value = m.mask;
        return 0;
    }
    for (int ch = 0; ch < SOUND_MIXER_NRDEVICES; ++ch) {
        if (request == static_cast<unsigned long>(MIXER_READ(ch))) {
            if (m.failRead || !(m.mask & (1 << ch))) {
                errno = EINVAL;
                return -1;
            }
            *value = m.levels[ch];
            return 0;
        }
        if (request == static_cast<unsigned long>(MIXER_WRITE(ch))) {
            if (m.failWrite || !(m.mask & (1 << ch))) {
                errno = EINVAL;
                return -1;
            }
            m.levels[ch] = *value;
            m.writtenChannels.push_back(ch);
            return 0;
        }
    }
    errno = ENOTTY;
    return -1;
}

class MixerTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        harness.reset(new tarntest::Harness());
        ASSERT_EQ("", harness->Error());
        g_card = &card;
        MixerOps ops = {FakeOpen, FakeIoctl, FakeClose};
        MixerSetOps(&ops);
    }
    void TearDown() override
    {
        // No descriptor is kept between calls.
        EXPECT_TRUE(card.openFds.empty());
        EXPECT_EQ(0, card.wrongFlags);
        MixerSetOps(nullptr);
        g_card = nullptr;
    }
    std::string Mixer(int n) { return harness->Path("/dev/mixer") + (n ? std::to_string(n) : ""); }
    std::string Dsp(int n) { return harness->Path("/dev/dsp") + (n ? std::to_string(n) : ""); }
    FakeMixer &Add(int n, int mask)
    {
        FakeMixer &m = card.mixers[Mixer(n)];
        m.mask = mask;
        return m;
    }
    std::string ReadConf() { return harness->ReadFile(TARN_INFO_CONF); }

    std::unique_ptr<tarntest::Harness> harness;
    FakeCard card;
};

const int kPcm = 1 << SOUND_MIXER_PCM;
const int kVolume = 1 << SOUND_MIXER_VOLUME;

TEST_F(MixerTest, FindsTheHighestNumberedMixer)
{
    char mixer[256] = "unchanged";
    char dsp[256] = "unchanged";
    EXPECT_EQ(-1, MixerFindDevice(mixer, sizeof(mixer), dsp, sizeof(dsp)));
    EXPECT_STREQ("unchanged", mixer);
    EXPECT_EQ(8u, card.openAttempts.size());
    EXPECT_EQ(Mixer(7), card.openAttempts.front());
    EXPECT_EQ(Mixer(0), card.openAttempts.back());

    Add(0, kPcm);
    EXPECT_EQ(0, MixerFindDevice(mixer, sizeof(mixer), dsp, sizeof(dsp)));
    EXPECT_EQ(Mixer(0), mixer);
    EXPECT_EQ(Dsp(0), dsp);
    EXPECT_EQ(harness->Root() + "/dev/mixer", std::string(mixer));
    EXPECT_EQ(harness->Root() + "/dev/dsp", std::string(dsp));

    Add(2, kPcm);
    Add(5, kPcm);
    EXPECT_EQ(5, MixerFindDevice(mixer, sizeof(mixer), dsp, sizeof(dsp)));
    EXPECT_EQ(harness->Root() + "/dev/mixer5", std::string(mixer));
    EXPECT_EQ(harness->Root() + "/dev/dsp5", std::string(dsp));
    EXPECT_EQ(5, MixerFindDevice(nullptr, 0, nullptr, 0));
    EXPECT_EQ(5, MixerFindDevice(mixer, sizeof(mixer), nullptr, 0));
    char small[4];
    EXPECT_EQ(5, MixerFindDevice(small, sizeof(small), nullptr, 0));
    EXPECT_EQ(3u, strlen(small));
}

TEST_F(MixerTest, ReadsThePcmChannelFirst)
{
    FakeMixer &m = Add(3, kVolume | kPcm | (1 << SOUND_MIXER_LINE));
    m.levels[SOUND_MIXER_VOLUME] = 10 | (10 << 8);
    m.levels[SOUND_MIXER_PCM] = 80 | (81 << 8);
    // The mean of left and right, rounded down.
    EXPECT_EQ(80, MixerGetVolume());
    m.levels[SOUND_MIXER_PCM] = 0 | (100 << 8);
    EXPECT_EQ(50, MixerGetVolume());
    // Levels above 100 read as 100.
    m.levels[SOUND_MIXER_PCM] = 0xff | (0xff << 8);
    EXPECT_EQ(100, MixerGetVolume());
    // Bits above the right byte are ignored.
    m.levels[SOUND_MIXER_PCM] = 40 | (60 << 8) | (0x7f << 16);
    EXPECT_EQ(50, MixerGetVolume());
}

TEST_F(MixerTest, WithoutPcmTheLowestChannelIsUsed)
{
    FakeMixer &m = Add(0, (1 << SOUND_MIXER_LINE) | (1 << SOUND_MIXER_CD) | (1 << 24));
    m.levels[SOUND_MIXER_LINE] = 30 | (30 << 8);
    m.levels[SOUND_MIXER_CD] = 90 | (90 << 8);
    EXPECT_EQ(30, MixerGetVolume());
    ASSERT_EQ(0, MixerSetVolume(0, 64));
    EXPECT_EQ(std::vector<int>{SOUND_MIXER_LINE}, m.writtenChannels);
    m.mask = 1 << 24;
    m.writtenChannels.clear();
    ASSERT_EQ(0, MixerSetVolume(0, 5));
    EXPECT_EQ(std::vector<int>{24}, m.writtenChannels);
    EXPECT_EQ(5, MixerGetVolume());
}

TEST_F(MixerTest, GetVolumeFailures)
{
    EXPECT_EQ(-1, MixerGetVolume());
    FakeMixer &m = Add(1, kPcm);
    // A mixer without channels reads as 0, not as a failure.
    m.mask = 0;
    EXPECT_EQ(0, MixerGetVolume());
    m.mask = kPcm;
    m.failRead = true;
    EXPECT_EQ(-1, MixerGetVolume());
    m.failRead = false;
    m.failMask = true;
    EXPECT_EQ(-1, MixerGetVolume());
}

TEST_F(MixerTest, SetVolumeClampsAndWritesBothSides)
{
    FakeMixer &m = Add(4, kPcm | kVolume);
    ASSERT_EQ(0, MixerSetVolume(4, 37));
    EXPECT_EQ(37 * 256 + 37, m.levels[SOUND_MIXER_PCM]);
    EXPECT_EQ(0, m.levels[SOUND_MIXER_VOLUME]);
    ASSERT_EQ(0, MixerSetVolume(4, 150));
    EXPECT_EQ(100 * 256 + 100, m.levels[SOUND_MIXER_PCM]);
    ASSERT_EQ(0, MixerSetVolume(4, -5));
    EXPECT_EQ(0, m.levels[SOUND_MIXER_PCM]);
    EXPECT_EQ(0, MixerGetVolume());
}

TEST_F(MixerTest, SetVolumeFailures)
{
    FakeMixer &m = Add(2, kPcm);
    EXPECT_EQ(-1, MixerSetVolume(3, 50));
    EXPECT_EQ(-1, MixerSetVolume(8, 50));
    EXPECT_EQ(-1, MixerSetVolume(-1, 50));
    m.mask = 0;
    EXPECT_EQ(-1, MixerSetVolume(2, 50));
    m.mask = kPcm;
    m.failWrite = true;
    EXPECT_EQ(-1, MixerSetVolume(2, 50));
    m.failWrite = false;
    m.failMask = true;
    EXPECT_EQ(-1, MixerSetVolume(2, 50));
    EXPECT_TRUE(m.writtenChannels.empty());
}

TEST_F(MixerTest, SetVolumeAllVisitsEveryDevice)
{
    EXPECT_EQ(-1, MixerSetVolumeAll(50));
    FakeMixer &a = Add(0, kPcm);
    FakeMixer &b = Add(6, kVolume);
    FakeMixer &c = Add(3, kPcm);
    c.failWrite = true;
    card.openAttempts.clear();
    // One device taking it is enough; all are tried, 7 down to 0.
    ASSERT_EQ(0, MixerSetVolumeAll(120));
    EXPECT_EQ(100 * 257, a.levels[SOUND_MIXER_PCM]);
    EXPECT_EQ(100 * 257, b.levels[SOUND_MIXER_VOLUME]);
    ASSERT_EQ(8u, card.openAttempts.size());
    for (int i = 0; i < 8; ++i)
        EXPECT_EQ(Mixer(7 - i), card.openAttempts[i]);
    a.failWrite = true;
    b.failWrite = true;
    EXPECT_EQ(-1, MixerSetVolumeAll(10));
}

TEST_F(MixerTest, SavedVolume)
{
    EXPECT_EQ(-1, VolumeConfGet());
    ASSERT_EQ(0, VolumeConfSet(42));
    EXPECT_EQ("audio_volume=\"42\"\n", ReadConf());
    EXPECT_EQ(42, VolumeConfGet());
    ASSERT_EQ(0, VolumeConfSet(150));
    EXPECT_EQ(100, VolumeConfGet());
    ASSERT_EQ(0, VolumeConfSet(-5));
    EXPECT_EQ(0, VolumeConfGet());
    EXPECT_EQ("audio_volume=\"0\"\n", ReadConf());

    // Other settings stay; the value is read without a range check.
    ASSERT_EQ(0, harness->WriteFile(TARN_INFO_CONF, "admin_port=8080\naudio_volume=250\naudio_enable_equalizer=yes\n"));
    EXPECT_EQ(250, VolumeConfGet());
    ASSERT_EQ(0, VolumeConfSet(7));
    EXPECT_EQ("admin_port=8080\naudio_volume=\"7\"\naudio_enable_equalizer=yes\n", ReadConf());
    ASSERT_EQ(0, harness->WriteFile(TARN_INFO_CONF, "audio_volume=loud\n"));
    EXPECT_EQ(0, VolumeConfGet());
    ASSERT_EQ(0, harness->WriteFile(TARN_INFO_CONF, "audio_volume=\n"));
    EXPECT_EQ(-1, VolumeConfGet());

    // A configuration that cannot be written.
    ASSERT_EQ(0, remove(harness->Path(TARN_INFO_CONF).c_str()));
    ASSERT_EQ(0, mkdir(harness->Path(TARN_INFO_CONF).c_str(), 0755));
    EXPECT_EQ(-1, VolumeConfSet(30));
}

TEST_F(MixerTest, ApplyingTheSavedVolume)
{
    FakeMixer &m = Add(0, kPcm);
    EXPECT_EQ(-1, VolumeApplySaved());
    EXPECT_TRUE(card.openAttempts.empty());
    ASSERT_EQ(0, VolumeConfSet(30));
    ASSERT_EQ(0, VolumeApplySaved());
    EXPECT_EQ(30 * 257, m.levels[SOUND_MIXER_PCM]);
    card.mixers.clear();
    EXPECT_EQ(-1, VolumeApplySaved());
}

TEST_F(MixerTest, VolumeFromTheDriverEntry)
{
    EXPECT_EQ(-1, VolumeSyncFromProc());
    EXPECT_EQ(-1, VolumeConfGet());
    ASSERT_EQ(0, harness->WriteFile(TARN_PROC_VOLUME, "73\n"));
    ASSERT_EQ(0, VolumeSyncFromProc());
    EXPECT_EQ(73, VolumeConfGet());
    ASSERT_EQ(0, harness->WriteFile(TARN_PROC_VOLUME, "250"));
    ASSERT_EQ(0, VolumeSyncFromProc());
    EXPECT_EQ(100, VolumeConfGet());
    // At most seven characters are read.
    ASSERT_EQ(0, harness->WriteFile(TARN_PROC_VOLUME, "0000012345\n"));
    ASSERT_EQ(0, VolumeSyncFromProc());
    EXPECT_EQ(12, VolumeConfGet());
    ASSERT_EQ(0, harness->WriteFile(TARN_PROC_VOLUME, ""));
    EXPECT_EQ(-1, VolumeSyncFromProc());
    EXPECT_EQ(12, VolumeConfGet());
}

// Without a stand-in the functions use the system calls: under a test root
// there is no mixer at all, and a plain file is no mixer either.
TEST(SystemMixer, NoMixerDevice)
{
    tarntest::Harness harness;
    ASSERT_EQ("", harness.Error());
    MixerSetOps(nullptr);
    EXPECT_EQ(-1, MixerFindDevice(nullptr, 0, nullptr, 0));
    EXPECT_EQ(-1, MixerGetVolume());
    EXPECT_EQ(-1, MixerSetVolumeAll(50));
    ASSERT_EQ(0, harness.WriteFile("/dev/mixer", "not a device"));
    char mixer[256];
    EXPECT_EQ(0, MixerFindDevice(mixer, sizeof(mixer), nullptr, 0));
    EXPECT_EQ(harness.Path("/dev/mixer"), mixer);
    EXPECT_EQ(-1, MixerGetVolume());
    EXPECT_EQ(-1, MixerSetVolume(0, 50));
    EXPECT_EQ(-1, MixerSetVolumeAll(50));
}

}  // namespace
