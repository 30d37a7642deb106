// Settings files on a full or read-only file system: "/etc/tarninfo.conf"
// (the saved volume), the radio station lists and the custom-slot settings.
//
// The test runs in a mount namespace of its own (unshare, every mount made
// private first) and mounts small tmpfs file systems over the root's etc
// and audio settings folders, then fills them to several levels (nothing
// left, a few kilobytes left, so that a write breaks off in the middle) or
// makes them read-only. The daemon must keep serving and end with status
// 0; every file must either keep its previous contents byte for byte or
// hold complete new contents, and no temporary file may be left behind.
// With space again, the same writes must succeed (so the checks above are
// not passing on writes that never happen).
#include <gtest/gtest.h>

#include <dirent.h>
#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <map>
#include <string>
#include <vector>

#include <json/json.h>

#include "daemon/tarn_types.h"
#include "platform/media_playlists.h"
#include "source/radiolist.h"
#include "tests/harness/harness.h"

namespace {

using tarntest::Harness;

const char kConf[] = "/etc/tarninfo.conf";
const char kSlots[] = "/usr/tarn/etc/audio/custom_slots.json";
const char kEtc[] = "/etc";
const char kAudio[] = "/usr/tarn/etc/audio";

std::string Stations(int n, const char *prefix)
{
    Json::Value list(Json::objectValue);
    list["stations"] = Json::Value(Json::arrayValue);
    for (int i = 0; i < n; ++i) {
        Json::Value s(Json::objectValue);
        s["name"] = std::string(prefix) + " station " + std::to_string(i);
        // A closed loopback port: a station that is played fails at once.
        s["url"] = "http://127.0.0.1:9/" + std::string(prefix) + std::to_string(i) + ".mp3";
        s["desc"] = "a description long enough to make the file span several pages";
        s["bitrate"] = "128";
        list["stations"].append(s);
    }
    list["total"] = n;
    return Json::StyledWriter().write(list);
}

bool ParsesAsList(const std::string &text, int *count)
{
    Json::Value v;
    if (!Json::Reader().parse(text, v) || !v.isObject() || !v["stations"].isArray())
        return false;
    *count = static_cast<int>(v["stations"].size());
    return v["total"].isIntegral() && v["total"].asInt() == *count;
}

// Files in a folder (not recursive) whose name holds "tmp" or "~".
std::vector<std::string> Leftovers(const std::string &dir)
{
    std::vector<std::string> out;
    DIR *d = opendir(dir.c_str());
    if (!d)
        return out;
    while (struct dirent *e = readdir(d)) {
        std::string n = e->d_name;
        if (n.find("tmp") != std::string::npos || n.find('~') != std::string::npos)
            out.push_back(dir + "/" + n);
    }
    closedir(d);
    return out;
}

class SettingsFiles : public ::testing::Test {
protected:
    static void SetUpTestSuite()
    {
        if (unshare(CLONE_NEWNS) != 0) {
            skipReason = std::string("no mount namespace: ") + strerror(errno);
            return;
        }
        if (mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0)
            skipReason = std::string("cannot make mounts private: ") + strerror(errno);
    }

    void SetUp() override
    {
        if (!skipReason.empty())
            GTEST_SKIP() << skipReason;
        ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run";
        h.reset(new Harness());
        for (const char *dir : {kEtc, kAudio}) {
            std::string p = h->Path(dir);
            ASSERT_EQ(0, mount("tmpfs", p.c_str(), "tmpfs", 0, "size=256k,mode=0755"))
                << p << ": " << strerror(errno);
            mounted.push_back(p);
        }
        ASSERT_EQ(0, mkdir(h->Path(TARN_RADIO_DIR).c_str(), 0755));
        ASSERT_EQ(0, h->WriteFile(kConf, "admin_port=8080\naudio_volume=40\naudio_enable_equalizer=0\n"));
        ASSERT_EQ(0, h->WriteFile(TARN_RADIO_FAVORITE, Stations(120, "fav")));
        ASSERT_EQ(0, h->WriteFile(TARN_RADIO_USERDEF, Stations(3, "user")));
        ASSERT_EQ(0, TARNAudioCustomSet(1, "radio", "http://127.0.0.1:9/old.mp3", "Old"));
        Snapshot();
    }

    void TearDown() override
    {
        if (HasFailure() && h)
            fprintf(stderr, "--- daemon log ---\n%s\n", h->Log().c_str());
        if (h)
            h->Stop();
        for (const std::string &p : mounted)
            umount2(p.c_str(), MNT_DETACH);
        h.reset();
    }

    void Snapshot()
    {
        for (const char *f : {kConf, kSlots, TARN_RADIO_FAVORITE, TARN_RADIO_USERDEF})
            before[f] = h->ReadFile(f);
    }

    // Fills every mounted folder until free bytes are left.
    void Fill(long freeBytes)
    {
        for (const std::string &dir : mounted) {
            std::string filler = dir + "/filler";
            int fd = open(filler.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
            ASSERT_GE(fd, 0);
            std::string chunk(4096, 'x');
            long written = 0;
            for (;;) {
                ssize_t n = write(fd, chunk.data(), chunk.size());
                if (n <= 0)
                    break;
                written += n;
            }
            ASSERT_EQ(ENOSPC, errno);
            ASSERT_EQ(0, ftruncate(fd, written > freeBytes ? written - freeBytes : 0));
            close(fd);
        }
    }

    void Unfill()
    {
        for (const std::string &dir : mounted)
            unlink((dir + "/filler").c_str());
    }

    void SetReadOnly(bool ro)
    {
        for (const std::string &p : mounted) {
            unsigned long flags = MS_REMOUNT | (ro ? MS_RDONLY : 0);
            ASSERT_EQ(0, mount("tmpfs", p.c_str(), "tmpfs", flags, "size=256k,mode=0755"))
                << p << ": " << strerror(errno);
        }
    }

    // Every write the system makes to these files: the daemon saves the
    // volume (on stop) and a custom slot; the web interface's programs edit
    // the radio lists and slots (in this process).
    void WriteEverything()
    {
        ASSERT_EQ(0, h->Start()) << h->Error();
        std::string reply;
        EXPECT_EQ(0, h->Request(ACT_SET_VOLUME, "77", &reply, 1000));
        EXPECT_EQ(0, h->Request(ACT_SOURCE_RADIO, nullptr, &reply, 3000));
        EXPECT_EQ(0, h->Request(ACT_SAVE_CUSTOM, "2", &reply, 3000));
        EXPECT_EQ(0, h->Request(ACT_GET_STATUS, nullptr, &reply, 1000)) << "the daemon stopped serving";
        Json::Value st;
        ASSERT_TRUE(Json::Reader().parse(reply, st));
        EXPECT_EQ(77, st["Volume"].asInt());
        EXPECT_EQ(0, h->Stop()) << "the daemon did not end cleanly";

        Json::Value add(Json::arrayValue);
        Json::Value s(Json::objectValue);
        s["name"] = "Added";
        s["url"] = "http://127.0.0.1:9/added.mp3";
        add.append(s);
        RadioListAdd(RADIO_LIST_FAVORITE, add);
        RadioListDelete(RADIO_LIST_FAVORITE, "0,1,2");
        RadioListEdit(RADIO_LIST_USERDEF, 1, s);
        TARNAudioCustomSet(3, "radio", "http://127.0.0.1:9/new.mp3", "New");
    }

    // Each file: unchanged, or complete new contents.
    void CheckWhole(bool mayChange)
    {
        std::string conf = h->ReadFile(kConf);
        if (conf != before[kConf]) {
            EXPECT_TRUE(mayChange) << "the configuration changed on a file system that takes no writes";
            EXPECT_EQ("admin_port=8080\naudio_volume=\"77\"\naudio_enable_equalizer=0\n", conf);
        }
        for (const char *f : {TARN_RADIO_FAVORITE, TARN_RADIO_USERDEF}) {
            std::string text = h->ReadFile(f);
            if (text == before[f])
                continue;
            EXPECT_TRUE(mayChange) << f << " changed on a file system that takes no writes";
            int count = 0;
            EXPECT_TRUE(ParsesAsList(text, &count)) << f << " is no whole list:\n" << text.substr(0, 400);
        }
        std::string slots = h->ReadFile(kSlots);
        if (slots != before[kSlots]) {
            EXPECT_TRUE(mayChange) << "the custom slots changed on a file system that takes no writes";
            Json::Value v;
            EXPECT_TRUE(Json::Reader().parse(slots, v) && v["slots"]["1"]["second"].asString() ==
                                                              "http://127.0.0.1:9/old.mp3")
                << "custom slots damaged:\n" << slots;
        }
        for (const std::string &dir : {h->Path(kEtc), h->Path(kAudio), h->Path(TARN_RADIO_DIR)}) {
            std::vector<std::string> left = Leftovers(dir);
            EXPECT_TRUE(left.empty()) << "temporary file left: " << left[0];
        }
    }

    // With room again, every write lands.
    void CheckWritesLandWithRoom()
    {
        Unfill();
        Snapshot();
        WriteEverything();
        CheckWhole(true);
        EXPECT_NE(std::string::npos, h->ReadFile(kConf).find("audio_volume=\"77\""));
        int fav = 0, user = 0;
        ASSERT_TRUE(ParsesAsList(h->ReadFile(TARN_RADIO_FAVORITE), &fav));
        ASSERT_TRUE(ParsesAsList(h->ReadFile(TARN_RADIO_USERDEF), &user));
        int favBefore = 0;
        ASSERT_TRUE(ParsesAsList(before[TARN_RADIO_FAVORITE], &favBefore));
        EXPECT_EQ(favBefore + 1 - 3, fav);
        std::string type, second, third;
        EXPECT_EQ(0, TARNAudioCustomGet(3, type, second, third));
        EXPECT_EQ("http://127.0.0.1:9/new.mp3", second);
        EXPECT_EQ(0, TARNAudioCustomGet(2, type, second, third));
        EXPECT_EQ("radio", type);
    }

    static std::string skipReason;
    std::unique_ptr<Harness> h;
    std::vector<std::string> mounted;
    std::map<std::string, std::string> before;
};

std::string SettingsFiles::skipReason;

TEST_F(SettingsFiles, FullFileSystemKeepsEveryFileWhole)
{
    for (long freeBytes : {0L, 1024L, 4096L, 12288L}) {
        SCOPED_TRACE("free bytes " + std::to_string(freeBytes));
        Fill(freeBytes);
        WriteEverything();
        CheckWhole(true);
        Unfill();
        Snapshot();
        if (HasFailure())
            return;
    }
    CheckWritesLandWithRoom();
}

TEST_F(SettingsFiles, ReadOnlyFileSystemKeepsEveryFile)
{
    SetReadOnly(true);
    WriteEverything();
    CheckWhole(false);
    SetReadOnly(false);
    CheckWritesLandWithRoom();
}

}  // namespace
