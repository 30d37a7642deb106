// Every source action through the control socket of a running tarnaudiod,
// with a media library built by tarnlib from generated songs. The queue is
// read back with ACT_QUEUE_LIST after each action.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <sys/stat.h>
#include <thread>
#include <vector>

#include <json/json.h>

#include "daemon/tarn_types.h"
#include "platform/media_playlists.h"
#include "tests/harness/harness.h"

namespace {

const std::string kCover = "modules/Aurelon/webUI/getcover.cgi/ebdart/";
const char kRandomFile[] = "/tmp/==DynaRandom100==.@remote_control";

class SourceActionsTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    std::string music, out;

    void SetUp() override
    {
        ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run";
        music = h.Path("/music");
        ASSERT_EQ(0, h.Run({"/bin/sh", tarntest::SourcePath("scripts/make-demo-songs.sh"), music, "1"}, &out)) << out;
        for (const char *w : {"wave-a", "wave-b", "wave-c"})
            ASSERT_EQ(0, h.Run({"/usr/bin/sox", "-q", "-n", "-r", "8000", "-c", "1", music + "/" + w + ".wav",
                                "synth", "1", "sine", "300"}));
        ASSERT_EQ(0, h.WriteFile("/music/first.m3u", "#PLAYLIST:First\ntone-440.mp3\ntone-660.flac\n"));
        ASSERT_EQ(0, h.WriteFile("/music/second.m3u", "#PLAYLIST:Second\ntone-880.ogg\n"));
        ASSERT_EQ(0, h.WriteFile("/music/third.m3u", "#PLAYLIST:Third\nwave-a.wav\nwave-b.wav\nwave-c.wav\n"));
        ASSERT_EQ(0, h.Run({tarntest::BinPath("tarnlib"), "scan", music}, &out)) << out;
        ASSERT_EQ(0, h.Run({tarntest::BinPath("tarnlib"), "smart", "create", "Waves", "path contains .wav"}, &out));
        ASSERT_EQ(0, h.Run({"/bin/mkdir", "-p", h.Path("/dev")}));
        ASSERT_EQ(0, h.Start()) << h.Error();
    }
    Json::Value Queue()
    {
        std::string reply;
        EXPECT_EQ(0, h.Request(ACT_QUEUE_LIST, "0 500", &reply));
        Json::Value v;
        EXPECT_TRUE(Json::Reader().parse(reply, v)) << reply;
        return v;
    }
    // The queue's "res" paths, the music folder cut off.
    std::string Res()
    {
        std::string s;
        Json::Value q = Queue();
        for (const Json::Value &e : q["uris"]) {
            std::string r = e["res"].asString();
            s += (r.rfind(music, 0) == 0 ? r.substr(music.size() + 1) : r) + " ";
        }
        return s;
    }
    // Sends a source action; the reply is always the JSON null value.
    void Source(int action, const char *param = nullptr)
    {
        std::string reply;
        ASSERT_EQ(0, h.Request(action, param, &reply)) << action;
        EXPECT_EQ("null\n", reply) << action;
    }
    // The changed flag as published, then cleared.
    int Changed()
    {
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
        const PublishedStatusShm *seg = h.PublishedSegment();
        int changed = seg ? seg->changed : -1;
        EXPECT_EQ(0, h.Request(ACT_CLEAR_CHANGED));
        return changed;
    }
    bool WaitPlaying(const std::string &uri)
    {
        for (int i = 0; i < 100; i++) {
            std::string reply;
            Json::Value v;
            if (h.Request(ACT_GET_STATUS, nullptr, &reply) == 0 && Json::Reader().parse(reply, v) &&
                v["CurrentUri"].asString() == uri)
                return true;
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
        }
        return false;
    }
    void WriteRadio(const char *file, int total, const std::vector<std::string> &names)
    {
        std::string text = "{\"total\": " + std::to_string(total) + ", \"stations\": [";
        for (const std::string &n : names)
            text += std::string(text.back() == '[' ? "" : ",") + "{\"name\": \"" + n +
                    "\", \"url\": \"http://127.0.0.1:9/" + n + "\"}";
        ASSERT_EQ(0, h.WriteFile(("/usr/tarn/etc/audio/radio/" + std::string(file)).c_str(), text + "]}"));
    }
    ino_t RandomFile()
    {
        struct stat st;
        return stat(h.Path(kRandomFile).c_str(), &st) == 0 ? st.st_ino : 0;
    }
};

TEST_F(SourceActionsTest, RandomSelectionIsMadeAfreshByEveryAction)
{
    Changed();
    Source(ACT_SOURCE_RANDOM);
    EXPECT_EQ(1, Changed());
    Json::Value q = Queue();
    ASSERT_EQ(6u, q["uris"].size());  // the whole library, fewer than 100 songs
    EXPECT_EQ(0, q["current"].asInt());
    std::vector<std::string> paths;
    for (const Json::Value &e : q["uris"]) {
        paths.push_back(e["res"].asString().substr(music.size() + 1));
        std::string id = e["item_id"].asString().substr(8);
        EXPECT_NE("0", id);
        EXPECT_EQ(kCover + id + ".jpg", e["albumArtURL"].asString());
    }
    std::sort(paths.begin(), paths.end());
    EXPECT_EQ((std::vector<std::string>{"tone-440.mp3", "tone-660.flac", "tone-880.ogg", "wave-a.wav",
                                        "wave-b.wav", "wave-c.wav"}), paths);
    EXPECT_TRUE(WaitPlaying(q["uris"][0]["res"].asString())) << h.Log();

    // Random, next and previous each write a new selection file.
    for (int action : {ACT_SOURCE_RANDOM, ACT_SOURCE_NEXT, ACT_SOURCE_PREVIOUS}) {
        ino_t before = RandomFile();
        Source(action);
        EXPECT_NE(before, RandomFile()) << action;
        EXPECT_EQ(1, Changed()) << action;
        EXPECT_EQ(6u, Queue()["uris"].size());
    }
}

TEST_F(SourceActionsTest, SavedPlaylistsInLibraryOrderWithWrap)
{
    Source(ACT_SOURCE_PLAYLIST);
    EXPECT_EQ("tone-440.mp3 tone-660.flac ", Res());
    EXPECT_TRUE(WaitPlaying(music + "/tone-440.mp3"));
    const char *third = "wave-a.wav wave-b.wav wave-c.wav ";
    struct Step { int action; const char *queue; } steps[] = {
        {ACT_SOURCE_NEXT, "tone-880.ogg "}, {ACT_SOURCE_NEXT, third},
        {ACT_SOURCE_NEXT, "tone-440.mp3 tone-660.flac "}, {ACT_SOURCE_PREVIOUS, third},
        {ACT_SOURCE_PREVIOUS, "tone-880.ogg "}};
    for (const Step &s : steps) {
        Source(s.action);
        EXPECT_EQ(s.queue, Res());
    }
}

TEST_F(SourceActionsTest, RadioFallbacksAndNoNextForRadio)
{
    // No JSON lists: the favourite stations come from the seed file.
    ASSERT_EQ(0, h.WriteFile("/usr/tarn/etc/audio/default_radio_station.asx",
                             "<ASX version=\"3.0\">\n<Entry>\n<TITLE>Seed One</TITLE>\n"
                             "<Ref href=\"http://127.0.0.1:9/seed1\"/>\n</Entry>\n<Entry>\n"
                             "<TITLE>Seed Two</TITLE>\n<Ref href=\"http://127.0.0.1:9/seed2\"/>\n</Entry>\n</ASX>\n"));
    Source(ACT_SOURCE_RADIO);
    Json::Value q = Queue()["uris"];
    ASSERT_EQ(2u, q.size());
    EXPECT_EQ("Seed One", q[0]["title"].asString());
    EXPECT_EQ("playing@0", q[0]["item_id"].asString());
    EXPECT_EQ("http://127.0.0.1:9/seed1 http://127.0.0.1:9/seed2 ", Res());

    // "total" 0 in the favourites: the user-defined list.
    WriteRadio("favorite.json", 0, {"Ignored"});
    WriteRadio("userdef.json", 2, {"Mine-1", "Mine-2"});
    Source(ACT_SOURCE_RADIO);
    EXPECT_EQ("http://127.0.0.1:9/Mine-1 http://127.0.0.1:9/Mine-2 ", Res());

    // Both empty: the RadioIO list (fresh, so not fetched again).
    WriteRadio("userdef.json", 0, {});
    WriteRadio("radioio.json", 2, {"d1", "d2"});
    Source(ACT_SOURCE_RADIO);
    EXPECT_EQ("http://127.0.0.1:9/d1 http://127.0.0.1:9/d2 ", Res());

    // Radio has no next or previous; every list empty: the change fails.
    Changed();
    Source(ACT_SOURCE_NEXT);
    Source(ACT_SOURCE_PREVIOUS);
    WriteRadio("radioio.json", 0, {});
    Source(ACT_SOURCE_RADIO);
    EXPECT_EQ(0, Changed());
    EXPECT_EQ("http://127.0.0.1:9/d1 http://127.0.0.1:9/d2 ", Res());
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

    // A saved playlist: stored with its title, signalled with 2; no change.
    Source(ACT_SOURCE_PLAYLIST);
    Source(ACT_SOURCE_NEXT);
    Changed();
    Source(ACT_SAVE_CUSTOM, "1");
    EXPECT_EQ(0, Changed());
    ASSERT_EQ(0, TARNAudioCustomGet(1, type, second, third));
    EXPECT_EQ("playlist|" + music + "/second.m3u|Second", type + "|" + second + "|" + third);
    EXPECT_EQ("2\n", h.ReadFile("/dev/ttyS1"));
    // A radio station: the current one.
    WriteRadio("favorite.json", 3, {"R0", "R1", "R2"});
    Source(ACT_SOURCE_RADIO);
    ASSERT_EQ(0, h.Request(ACT_QUEUE_SET_CURRENT, "2"));
    Source(ACT_SAVE_CUSTOM, "2");
    ASSERT_EQ(0, TARNAudioCustomGet(2, type, second, third));
    EXPECT_EQ("radio|http://127.0.0.1:9/R2|R2", type + "|" + second + "|" + third);

    // Loading: the playlist slot (no next), the radio slot, a smart one.
    ASSERT_EQ(0, h.Run({tarntest::BinPath("tarnlib"), "custom", "set", "3", "smart", "Waves", ""}, &out)) << out;
    ASSERT_EQ(0, TARNAudioCustomSet(4, "playlist", music + "/deleted.m3u", "Deleted"));
    ASSERT_EQ(0, TARNAudioCustomSet(5, "Radio", "http://127.0.0.1:9/x", "X"));
    Source(ACT_SOURCE_RANDOM);
    Changed();
    struct Step { int action; const char *param; int changed; const char *queue; } steps[] = {
        {ACT_SOURCE_CUSTOM, "1", 1, "tone-880.ogg "},
        {ACT_SOURCE_NEXT, nullptr, 0, "tone-880.ogg "},
        {ACT_SOURCE_CUSTOM, "2", 1, "http://127.0.0.1:9/R2 "},
        {ACT_SOURCE_CUSTOM, "3", 1, "wave-a.wav wave-b.wav wave-c.wav "},
        {ACT_SOURCE_CUSTOM, "4", 1, "wave-a.wav wave-b.wav wave-c.wav "},  // deleted: queue kept
        {ACT_SOURCE_CUSTOM, "5", 0, "wave-a.wav wave-b.wav wave-c.wav "},  // type texts are exact
        {ACT_SOURCE_CUSTOM, "42", 0, "wave-a.wav wave-b.wav wave-c.wav "}};
    for (const Step &s : steps) {
        Source(s.action, s.param);
        EXPECT_EQ(s.changed, Changed()) << (s.param ? s.param : "next");
        EXPECT_EQ(s.queue, Res()) << (s.param ? s.param : "next");
    }
    EXPECT_EQ(1, h.CountLog("invalid custom type [Radio]"));
}

TEST_F(SourceActionsTest, IpodTrackListAndNoNext)
{
    Source(ACT_SOURCE_PLAYLIST);
    Changed();
    Source(ACT_SOURCE_IPOD);  // no track list
    EXPECT_EQ(0, Changed());
    EXPECT_EQ("tone-440.mp3 tone-660.flac ", Res());
    ASSERT_EQ(0, h.WriteFile("/usr/tarn/etc/audio/ipod/tracks.m3u", "#EXTM3U\n#EXTINF:1,Band - Wave C\n" +
                                 music + "/wave-c.wav\n" + music + "/tone-880.ogg\n"));
    Source(ACT_SOURCE_IPOD);
    EXPECT_EQ(1, Changed());
    EXPECT_EQ("wave-c.wav tone-880.ogg ", Res());
    EXPECT_EQ(std::string::npos, Queue()["uris"][0]["albumArtURL"].asString().find(kCover));
    EXPECT_TRUE(WaitPlaying(music + "/wave-c.wav"));
    Source(ACT_SOURCE_NEXT);  // no next for iPod
    EXPECT_EQ(0, Changed());
    EXPECT_EQ("wave-c.wav tone-880.ogg ", Res());
}

// A source change while the player process is still coming up (a slow
// first start) ends that process and plays the new source at once.
TEST_F(SourceActionsTest, SourceChangeWhileThePlayerStartsPlaysTheNewSource)
{
    // The slow start: a script under the root (its shell too, so that the
    // daemon, which ends only players of its own root, sees it as one).
    const std::string bin = h.Path(TARN_MPLAYER_BIN), shell = bin + "-sh";
    ASSERT_EQ(0, rename(bin.c_str(), (bin + ".real").c_str()));
    ASSERT_EQ(0, h.Run({"/bin/cp", "/bin/sh", shell}));
    ASSERT_EQ(0, h.WriteFile(TARN_MPLAYER_BIN, "#!" + shell + "\nsleep 1\nexec '" + bin + ".real' \"$@\"\n"));
    ASSERT_EQ(0, chmod(bin.c_str(), 0755));
    ASSERT_EQ(0, h.WriteFile("/usr/tarn/etc/audio/ipod/tracks.m3u", music + "/wave-c.wav\n"));
    Source(ACT_SOURCE_PLAYLIST);
    Source(ACT_SOURCE_IPOD);
    EXPECT_EQ("wave-c.wav ", Res());
    EXPECT_TRUE(WaitPlaying(music + "/wave-c.wav"));
}

}  // namespace
