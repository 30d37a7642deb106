// Every source action through the control socket of a running tarnaudiod,
// with a media library built by tarnlib from generated songs. The queue is
// read back with ACT_QUEUE_LIST after each action.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <dirent.h>
#include <string>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include <httplib.h>
#include <json/json.h>

#include "daemon/tarn_types.h"
#include "platform/media_playlists.h"
#include "tests/harness/harness.h"

namespace {

const char kCoverPrefix[] = "modules/Aurelon/webUI/getcover.cgi/ebdart/";
const char kRandomFile[] = "/tmp/==DynaRandom100==.@remote_control";

struct Entry {
    std::string title, res, art, itemId;
};

class SourceActionsTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    std::string music;

    void SetUp() override
    {
        ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run";
        ASSERT_TRUE(h.Error().empty()) << h.Error();
        music = h.Path("/music");
        std::string out;
        ASSERT_EQ(0, h.Run({"/bin/sh", tarntest::SourcePath("scripts/make-demo-songs.sh"), music, "1"}, &out))
            << out;
        for (const char *w : {"wave-a", "wave-b", "wave-c"})
            ASSERT_EQ(0, h.Run({"/usr/bin/sox", "-q", "-n", "-r", "8000", "-c", "1", music + "/" + w + ".wav",
                                "synth", "1", "sine", "300"}));
        ASSERT_EQ(0, h.WriteFile("/music/first.m3u", "#PLAYLIST:First\ntone-440.mp3\ntone-660.flac\n"));
        ASSERT_EQ(0, h.WriteFile("/music/second.m3u", "#PLAYLIST:Second\ntone-880.ogg\n"));
        ASSERT_EQ(0, h.WriteFile("/music/third.m3u", "#PLAYLIST:Third\nwave-a.wav\nwave-b.wav\nwave-c.wav\n"));
        ASSERT_EQ(0, h.Run({tarntest::BinPath("tarnlib"), "scan", music}, &out)) << out;
        ASSERT_EQ(0, h.Run({tarntest::BinPath("tarnlib"), "smart", "create", "Waves", "path contains .wav"}, &out))
            << out;
        ASSERT_EQ(0, h.Run({"/bin/mkdir", "-p", h.Path("/dev")}));
        ASSERT_EQ(0, h.Start()) << h.Error();
    }

    std::vector<Entry> Queue(int *current = nullptr)
    {
        std::string reply;
        EXPECT_EQ(0, h.Request(ACT_QUEUE_LIST, "0 500", &reply));
        Json::Value v;
        Json::Reader r;
        EXPECT_TRUE(r.parse(reply, v)) << reply;
        std::vector<Entry> q;
        for (const Json::Value &e : v["uris"])
            q.push_back({e["title"].asString(), e["res"].asString(), e["albumArtURL"].asString(),
                         e["item_id"].asString()});
        if (current)
            *current = v["current"].asInt();
        return q;
    }
    std::vector<std::string> Res()
    {
        std::vector<std::string> r;
        for (const Entry &e : Queue())
            r.push_back(e.res);
        return r;
    }
    std::vector<std::string> Songs(std::initializer_list<const char *> names)
    {
        std::vector<std::string> r;
        for (const char *n : names)
            r.push_back(music + "/" + n);
        return r;
    }
    // Sends a source action; the reply is always the JSON null value.
    void Source(int action, const char *param = nullptr)
    {
        std::string reply;
        ASSERT_EQ(0, h.Request(action, param, &reply)) << action;
        EXPECT_EQ("null\n", reply) << action;
    }
    // The changed flag as published (a few loop turns to settle).
    int Changed()
    {
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
        const PublishedStatusShm *seg = h.PublishedSegment();
        return seg ? seg->changed : -1;
    }
    void ClearChanged()
    {
        ASSERT_EQ(0, h.Request(ACT_CLEAR_CHANGED));
        ASSERT_EQ(0, Changed());
    }
    // Waits until mplayer-daemon reports uri as the song it plays.
    bool WaitPlaying(const std::string &uri)
    {
        for (int i = 0; i < 100; i++) {
            std::string reply;
            if (h.Request(ACT_GET_STATUS, nullptr, &reply) == 0) {
                Json::Value v;
                Json::Reader r;
                if (r.parse(reply, v) && v["CurrentUri"].asString() == uri)
                    return true;
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
        }
        return false;
    }
    // Processes whose executable is the root's mplayer-daemon.
    int CountDecoders()
    {
        std::string exe = h.Path("/usr/tarn/bin/mplayer-daemon");
        int n = 0;
        DIR *d = opendir("/proc");
        if (!d)
            return -1;
        while (dirent *e = readdir(d)) {
            char link[64], target[4096];
            snprintf(link, sizeof(link), "/proc/%s/exe", e->d_name);
            ssize_t len = readlink(link, target, sizeof(target) - 1);
            if (len <= 0)
                continue;
            target[len] = '\0';
            if (exe == target)  // (a zombie has no executable link)
                n++;
        }
        closedir(d);
        return n;
    }
    void WriteRadio(const char *file, int total, const std::vector<std::string> &names)
    {
        Json::Value list(Json::objectValue);
        list["stations"] = Json::Value(Json::arrayValue);
        for (const std::string &n : names) {
            Json::Value s(Json::objectValue);
            s["name"] = n;
            s["url"] = "http://127.0.0.1:9/" + n;
            s["desc"] = "";
            s["bitrate"] = "128";
            list["stations"].append(s);
        }
        list["total"] = total;
        Json::StyledWriter w;
        ASSERT_EQ(0, h.WriteFile((std::string("/usr/tarn/etc/audio/radio/") + file).c_str(), w.write(list)));
    }
};

TEST_F(SourceActionsTest, RandomSelectionReplacesTheQueueAndPlaysItsFirstSong)
{
    ClearChanged();
    Source(ACT_SOURCE_RANDOM);
    EXPECT_EQ(1, Changed());
    int current = -1;
    std::vector<Entry> q = Queue(&current);
    ASSERT_EQ(6u, q.size());  // the whole library, fewer than 100 songs
    EXPECT_EQ(0, current);
    std::vector<std::string> paths;
    for (const Entry &e : q) {
        paths.push_back(e.res);
        ASSERT_EQ(0u, e.itemId.rfind("playing@", 0));
        std::string id = e.itemId.substr(8);
        EXPECT_NE("0", id);
        EXPECT_EQ(kCoverPrefix + id + ".jpg", e.art);
    }
    std::sort(paths.begin(), paths.end());
    EXPECT_EQ(Songs({"tone-440.mp3", "tone-660.flac", "tone-880.ogg", "wave-a.wav", "wave-b.wav", "wave-c.wav"}),
              paths);
    EXPECT_TRUE(WaitPlaying(q[0].res)) << h.Log();

    // Every request writes a new random file.
    struct stat first, second;
    ASSERT_EQ(0, stat(h.Path(kRandomFile).c_str(), &first));
    Source(ACT_SOURCE_RANDOM);
    ASSERT_EQ(0, stat(h.Path(kRandomFile).c_str(), &second));
    EXPECT_NE(first.st_ino, second.st_ino);
    EXPECT_EQ(6u, Queue().size());

    // Next and previous make new selections while the source is random.
    ClearChanged();
    Source(ACT_SOURCE_NEXT);
    EXPECT_EQ(1, Changed());
    ASSERT_EQ(0, stat(h.Path(kRandomFile).c_str(), &first));
    EXPECT_NE(first.st_ino, second.st_ino);
    Source(ACT_SOURCE_PREVIOUS);
    ASSERT_EQ(0, stat(h.Path(kRandomFile).c_str(), &second));
    EXPECT_NE(first.st_ino, second.st_ino);
    q = Queue();
    ASSERT_EQ(6u, q.size());
    EXPECT_TRUE(WaitPlaying(q[0].res));
    // Each change stopped the decoder before starting it again.
    EXPECT_EQ(1, CountDecoders());
}

TEST_F(SourceActionsTest, SavedPlaylistsInLibraryOrderWithWrap)
{
    Source(ACT_SOURCE_PLAYLIST);
    EXPECT_EQ(Songs({"tone-440.mp3", "tone-660.flac"}), Res());
    EXPECT_TRUE(WaitPlaying(music + "/tone-440.mp3"));
    Source(ACT_SOURCE_NEXT);
    EXPECT_EQ(Songs({"tone-880.ogg"}), Res());
    Source(ACT_SOURCE_NEXT);
    EXPECT_EQ(Songs({"wave-a.wav", "wave-b.wav", "wave-c.wav"}), Res());
    Source(ACT_SOURCE_NEXT);
    EXPECT_EQ(Songs({"tone-440.mp3", "tone-660.flac"}), Res());
    Source(ACT_SOURCE_PREVIOUS);
    EXPECT_EQ(Songs({"wave-a.wav", "wave-b.wav", "wave-c.wav"}), Res());
    EXPECT_TRUE(WaitPlaying(music + "/wave-a.wav"));
    Source(ACT_SOURCE_PREVIOUS);
    EXPECT_EQ(Songs({"tone-880.ogg"}), Res());
    EXPECT_EQ(1, CountDecoders());
}

TEST_F(SourceActionsTest, RadioFallbacksAndNoNextForRadio)
{
    // No JSON lists: the favourite stations come from the seed file. (Its
    // streams are on loopback: the decoder really opens them.)
    ASSERT_EQ(0, h.WriteFile("/usr/tarn/etc/audio/default_radio_station.asx",
                             "<ASX version=\"3.0\">\n"
                             "<Entry>\n<TITLE>Seed One</TITLE>\n<Ref href=\"http://127.0.0.1:9/seed1\"/>\n</Entry>\n"
                             "<Entry>\n<TITLE>Seed Two</TITLE>\n<Ref href=\"http://127.0.0.1:9/seed2\"/>\n</Entry>\n"
                             "</ASX>\n"));
    Source(ACT_SOURCE_RADIO);
    std::vector<Entry> q = Queue();
    ASSERT_EQ(2u, q.size());
    EXPECT_EQ("Seed One", q[0].title);
    EXPECT_EQ("http://127.0.0.1:9/seed1", q[0].res);
    EXPECT_EQ("playing@0", q[0].itemId);
    EXPECT_EQ(std::string::npos, q[0].art.find(kCoverPrefix));

    // Favourite total 0: the user-defined list.
    WriteRadio("favorite.json", 0, {"Ignored"});
    WriteRadio("userdef.json", 2, {"Mine-1", "Mine-2"});
    Source(ACT_SOURCE_RADIO);
    q = Queue();
    ASSERT_EQ(2u, q.size());
    EXPECT_EQ("Mine-1", q[0].title);
    EXPECT_EQ("http://127.0.0.1:9/Mine-2", q[1].res);

    // Both empty: the RadioIO list, fetched from the configured directory.
    WriteRadio("userdef.json", 0, {});
    httplib::Server server;
    int hits = 0;
    server.Get("/json/stations/topclick/.*", [&hits](const httplib::Request &, httplib::Response &res) {
        hits++;
        res.set_content(R"([{"name": "Directory One", "url": "http://127.0.0.1:9/d1", "bitrate": 64},
                            {"name": "Directory Two", "url_resolved": "http://127.0.0.1:9/d2", "bitrate": 128}])",
                        "application/json");
    });
    int port = server.bind_to_any_port("127.0.0.1");
    ASSERT_GT(port, 0);
    std::thread serverThread([&server] { server.listen_after_bind(); });
    ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "radio_directory_url=http://127.0.0.1:" + std::to_string(port) +
                                                 "\nradio_directory_timeout=3\n"));
    Source(ACT_SOURCE_RADIO);
    Source(ACT_SOURCE_RADIO);  // fresh: not fetched again
    server.stop();
    serverThread.join();
    EXPECT_EQ(1, hits);
    q = Queue();
    ASSERT_EQ(2u, q.size());
    EXPECT_EQ("Directory One", q[0].title);
    EXPECT_EQ("http://127.0.0.1:9/d2", q[1].res);

    // Radio has no next or previous: nothing changes.
    ClearChanged();
    Source(ACT_SOURCE_NEXT);
    Source(ACT_SOURCE_PREVIOUS);
    EXPECT_EQ(0, Changed());
    EXPECT_EQ(2u, Queue().size());

    // Every list empty: the change fails and the queue stays.
    WriteRadio("radioio.json", 0, {});
    Source(ACT_SOURCE_RADIO);
    EXPECT_EQ(0, Changed());
    EXPECT_EQ(2u, Queue().size());
    EXPECT_EQ(1, h.CountLog("Failed to get radio list for changing source."));
}

TEST_F(SourceActionsTest, CustomSlotsSavedAndLoaded)
{
    // Saving a random selection stores nothing and sends no signal.
    Source(ACT_SOURCE_RANDOM);
    Source(ACT_SAVE_CUSTOM, "1");
    std::string type, second, third;
    EXPECT_EQ(-1, TARNAudioCustomGet(1, type, second, third));
    EXPECT_FALSE(h.Exists("/dev/ttyS1"));

    // A saved playlist: stored with its title, signalled with 2.
    Source(ACT_SOURCE_PLAYLIST);
    Source(ACT_SOURCE_NEXT);
    ClearChanged();
    Source(ACT_SAVE_CUSTOM, "1");
    EXPECT_EQ(0, Changed());  // saving is no source change
    ASSERT_EQ(0, TARNAudioCustomGet(1, type, second, third));
    EXPECT_EQ("playlist", type);
    EXPECT_EQ(music + "/second.m3u", second);
    EXPECT_EQ("Second", third);
    EXPECT_EQ("2\n", h.ReadFile("/dev/ttyS1"));

    // A radio station: the current one.
    WriteRadio("favorite.json", 3, {"R0", "R1", "R2"});
    Source(ACT_SOURCE_RADIO);
    ASSERT_EQ(0, h.Request(ACT_QUEUE_SET_CURRENT, "2"));
    Source(ACT_SAVE_CUSTOM, "2");
    ASSERT_EQ(0, TARNAudioCustomGet(2, type, second, third));
    EXPECT_EQ("radio", type);
    EXPECT_EQ("http://127.0.0.1:9/R2", second);
    EXPECT_EQ("R2", third);

    // Loading: the playlist slot, then the radio slot, then a smart one.
    Source(ACT_SOURCE_RANDOM);
    ClearChanged();
    Source(ACT_SOURCE_CUSTOM, "1");
    EXPECT_EQ(1, Changed());
    EXPECT_EQ(Songs({"tone-880.ogg"}), Res());
    Source(ACT_SOURCE_NEXT);  // a slot has no next
    EXPECT_EQ(Songs({"tone-880.ogg"}), Res());
    Source(ACT_SOURCE_CUSTOM, "2");
    std::vector<Entry> q = Queue();
    ASSERT_EQ(1u, q.size());
    EXPECT_EQ("R2", q[0].title);
    EXPECT_EQ("http://127.0.0.1:9/R2", q[0].res);
    std::string out;
    ASSERT_EQ(0, h.Run({tarntest::BinPath("tarnlib"), "custom", "set", "3", "smart", "Waves", ""}, &out)) << out;
    Source(ACT_SOURCE_CUSTOM, "3");
    EXPECT_EQ(Songs({"wave-a.wav", "wave-b.wav", "wave-c.wav"}), Res());

    // A slot whose playlist was deleted: success, queue untouched.
    ASSERT_EQ(0, TARNAudioCustomSet(4, "playlist", music + "/deleted.m3u", "Deleted"));
    ClearChanged();
    Source(ACT_SOURCE_CUSTOM, "4");
    EXPECT_EQ(1, Changed());
    EXPECT_EQ(Songs({"wave-a.wav", "wave-b.wav", "wave-c.wav"}), Res());
    // Another case of a type text is no type; an empty slot fails silently.
    ASSERT_EQ(0, TARNAudioCustomSet(5, "Radio", "http://127.0.0.1:9/x", "X"));
    ClearChanged();
    Source(ACT_SOURCE_CUSTOM, "5");
    Source(ACT_SOURCE_CUSTOM, "42");
    EXPECT_EQ(0, Changed());
    EXPECT_EQ(1, h.CountLog("invalid custom type [Radio]"));
    EXPECT_EQ(3u, Queue().size());
}

TEST_F(SourceActionsTest, IpodListAndFailuresKeepTheQueue)
{
    Source(ACT_SOURCE_PLAYLIST);
    ClearChanged();
    Source(ACT_SOURCE_IPOD);  // no track list
    EXPECT_EQ(0, Changed());
    EXPECT_EQ(Songs({"tone-440.mp3", "tone-660.flac"}), Res());

    ASSERT_EQ(0, h.WriteFile("/usr/tarn/etc/audio/ipod/tracks.m3u",
                             "#EXTM3U\n#EXTINF:1,Band - Wave C\n" + music + "/wave-c.wav\n" + music +
                                 "/tone-880.ogg\n"));
    Source(ACT_SOURCE_IPOD);
    EXPECT_EQ(1, Changed());
    std::vector<Entry> q = Queue();
    ASSERT_EQ(2u, q.size());
    EXPECT_EQ(music + "/wave-c.wav", q[0].res);
    EXPECT_EQ(music + "/tone-880.ogg", q[1].res);
    EXPECT_EQ(std::string::npos, q[0].art.find(kCoverPrefix));  // no cover for iPod tracks
    EXPECT_TRUE(WaitPlaying(music + "/wave-c.wav"));
    ClearChanged();
    Source(ACT_SOURCE_NEXT);
    EXPECT_EQ(0, Changed());
    EXPECT_EQ(2u, Queue().size());
}

TEST_F(SourceActionsTest, NoSavedPlaylistKeepsTheQueue)
{
    for (const char *f : {"/music/first.m3u", "/music/second.m3u", "/music/third.m3u"})
        ASSERT_EQ(0, unlink(h.Path(f).c_str()));
    std::string out;
    ASSERT_EQ(0, h.Run({tarntest::BinPath("tarnlib"), "scan", music}, &out)) << out;
    Source(ACT_SOURCE_RANDOM);
    std::vector<std::string> before = Res();
    ClearChanged();
    h.ClearLog();
    Source(ACT_SOURCE_PLAYLIST);
    EXPECT_EQ(0, Changed());
    EXPECT_EQ(before, Res());
    EXPECT_EQ(0, h.CountLog("changesrc:"));
}

}  // namespace
