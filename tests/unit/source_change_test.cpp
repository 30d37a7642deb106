// Source change against a real media library (songs generated with sox and
// scanned) and a real LocalPlayer whose queue is inspected directly.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include <json/json.h>

#include "daemon/globals.h"
#include "platform/media_playlists.h"
#include "platform/medialib.h"
#include "player/localplayer.h"
#include "player/playlist.h"
#include "source/changesrc.h"
#include "source/radiolist.h"
#include "tests/harness/harness.h"

namespace {

const char kCoverPrefix[] = "modules/Aurelon/webUI/getcover.cgi/ebdart/";

class SourceChangeTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    LocalPlayer *player = nullptr;
    std::string music;

    void SetUp() override
    {
        ASSERT_TRUE(h.Error().empty()) << h.Error();
        // No decoder process in these tests: starting playback fails and is
        // only logged; the queue is what is looked at.
        unlink(h.Path("/usr/tarn/bin/mplayer-daemon").c_str());
        g_sourceType = 0;
        g_currentPlaylistPath[0] = '\0';
        music = h.Path("/music");
        player = new LocalPlayer();
    }
    void TearDown() override { delete player; }

    // Makes a short WAV song at path (folders created).
    void Song(const std::string &path)
    {
        std::string dir = path.substr(0, path.rfind('/'));
        ASSERT_EQ(0, h.Run({"/bin/mkdir", "-p", dir}));
        ASSERT_EQ(0, h.Run({"/usr/bin/sox", "-q", "-n", "-r", "8000", "-c", "1", path, "synth", "0.2", "sine", "440"}))
            << "sox is needed (scripts/setup.sh)";
    }
    // A library of n songs (song0.wav ...) plus the given M3U files.
    void Library(int n, const std::vector<std::pair<std::string, std::string>> &m3u = {})
    {
        for (int i = 0; i < n; i++)
            Song(music + "/song" + std::to_string(i) + ".wav");
        for (const auto &f : m3u)
            ASSERT_EQ(0, h.WriteFile(("/music/" + f.first).c_str(), f.second));
        Rescan();
    }
    void Rescan()
    {
        ASSERT_EQ(0, h.Run({"/bin/mkdir", "-p", h.Path("/usr/tarn/var"), music}));
        MediaLib lib;
        ASSERT_EQ(0, lib.Open(MediaLibDefaultPath(), true)) << lib.LastError();
        ScanReport report;
        ASSERT_EQ(0, lib.Scan(music, &report)) << lib.LastError();
    }
    Playlist *Queue() { return player->GetPlaylist(); }
    std::vector<std::string> Titles()
    {
        std::vector<std::string> t;
        for (unsigned i = 0; i < Queue()->Count(); i++)
            t.push_back(Queue()->Entry(i)->title);
        return t;
    }
    std::vector<std::string> Paths()
    {
        std::vector<std::string> t;
        for (unsigned i = 0; i < Queue()->Count(); i++)
            t.push_back(Queue()->Entry(i)->path);
        return t;
    }
    // A queue of one marker song, to see whether a failed change kept it.
    void Marker()
    {
        TARN_MEDIA_INFO info = tarntest::MakeMediaInfo("/marker.mp3", "Marker");
        Queue()->Clear();
        Queue()->AddSong(&info);
    }
    bool QueueIsMarker() { return Queue()->Count() == 1 && std::string(Queue()->Entry(0)->title) == "Marker"; }
    std::string Radio(const char *name, int total, const std::vector<std::string> &stations)
    {
        Json::Value list(Json::objectValue);
        list["stations"] = Json::Value(Json::arrayValue);
        for (const std::string &s : stations) {
            Json::Value st(Json::objectValue);
            st["name"] = s;
            st["url"] = "http://radio/" + s;
            st["bitrate"] = "128";
            list["stations"].append(st);
        }
        list["total"] = total;
        Json::StyledWriter w;
        std::string text = w.write(list);
        EXPECT_EQ(0, h.WriteFile((std::string(TARN_RADIO_DIR "/") + name).c_str(), text));
        return text;
    }
};

TEST_F(SourceChangeTest, NullPlayerIsABadParameter)
{
    h.ClearLog();
    EXPECT_EQ(-1, ChangeSourceRandom100(nullptr, true));
    EXPECT_EQ(-1, ChangeSourceRadio(nullptr));
    EXPECT_EQ(-1, ChangeSourceIPod(nullptr));
    EXPECT_EQ(-1, ChangeSourceFirstPlaylist(nullptr));
    EXPECT_EQ(-1, ChangeSourceCustom(1, nullptr));
    EXPECT_EQ(-1, ChangeSourceNext(nullptr));
    EXPECT_EQ(-1, ChangeSourcePrevious(nullptr));
    EXPECT_EQ(-1, SaveCustomSource(1, nullptr));
    EXPECT_EQ(8, h.CountLog("Bad parameter."));
    EXPECT_EQ(8, h.CountLog("changesrc:"));
    EXPECT_EQ(0, g_sourceType);
}

TEST_F(SourceChangeTest, RandomSelectionIsMadeAfreshEachTime)
{
    Marker();
    h.ClearLog();
    // An empty library: nothing to pick, the old queue stays.
    EXPECT_EQ(-1, ChangeSourceRandom100(player, true));
    EXPECT_EQ(1, h.CountLog("Failed to create random100 playlist"));
    EXPECT_TRUE(QueueIsMarker());
    EXPECT_EQ(0, g_sourceType);

    Library(6);
    ASSERT_EQ(0, ChangeSourceRandom100(player, true));
    EXPECT_EQ(1, g_sourceType);
    ASSERT_EQ(6u, Queue()->Count());
    EXPECT_EQ(0u, Queue()->Current());
    std::vector<std::string> paths = Paths();
    std::sort(paths.begin(), paths.end());
    EXPECT_EQ(paths.end(), std::unique(paths.begin(), paths.end()));
    for (unsigned i = 0; i < 6; i++) {
        const TARN_MEDIA_INFO *e = Queue()->Entry(i);
        ASSERT_NE(0u, e->id);
        EXPECT_EQ(std::string(kCoverPrefix) + std::to_string(e->id) + ".jpg", e->albumArtUrl);
    }

    // The file is rewritten by every request, never reused.
    const char *file = "/tmp/==DynaRandom100==.@remote_control";
    ASSERT_TRUE(h.Exists(file));
    ASSERT_EQ(0, h.WriteFile(file, "#EXTM3U\n" + music + "/song2.wav\n"));
    ASSERT_EQ(0, ChangeSourceRandom100(player, true));
    EXPECT_EQ(6u, Queue()->Count());
    // Without regeneration an existing file is loaded as it is.
    ASSERT_EQ(0, h.WriteFile(file, "#EXTM3U\n" + music + "/song2.wav\n" + music + "/song4.wav\n"));
    ASSERT_EQ(0, ChangeSourceRandom100(player, false));
    EXPECT_EQ((std::vector<std::string>{music + "/song2.wav", music + "/song4.wav"}), Paths());

    // A folder in the file's place is no file to reuse: a new selection is
    // asked for, cannot be written over the folder, and the queue stays.
    ASSERT_EQ(0, unlink(h.Path(file).c_str()));
    ASSERT_EQ(0, mkdir(h.Path(file).c_str(), 0755));
    h.ClearLog();
    EXPECT_EQ(-1, ChangeSourceRandom100(player, false));
    EXPECT_EQ(1, h.CountLog("Failed to create random100 playlist"));
    EXPECT_EQ(2u, Queue()->Count());
}

TEST_F(SourceChangeTest, RadioFallsBackFromFavouriteToUserDefinedToRadioio)
{
    Marker();
    // Nothing anywhere: favourite and user-defined read as empty, RadioIO
    // has no file and no directory to fetch it from.
    h.ClearLog();
    EXPECT_EQ(-1, ChangeSourceRadio(player));
    EXPECT_EQ(1, h.CountLog("Failed to get RadioIO radio list."));
    EXPECT_EQ(1, h.CountLog("Failed to get radio list for changing source."));
    EXPECT_TRUE(QueueIsMarker());

    // The shipped favourite stations play on a fresh appliance.
    ASSERT_EQ(0, h.WriteFile("/usr/tarn/etc/audio/default_radio_station.asx",
                             "<Entry>\n<TITLE>Seed A</TITLE>\n<Ref href=\"http://seed/a\"/>\n</Entry>\n"
                             "<Entry>\n<TITLE>Seed B</TITLE>\n<Ref href=\"http://seed/b\"/>\n</Entry>\n"));
    ASSERT_EQ(0, ChangeSourceRadio(player));
    EXPECT_EQ(2, g_sourceType);
    EXPECT_EQ((std::vector<std::string>{"Seed A", "Seed B"}), Titles());
    EXPECT_EQ((std::vector<std::string>{"http://seed/a", "http://seed/b"}), Paths());
    EXPECT_EQ(0, Queue()->Entry(0)->id);
    EXPECT_STREQ("", Queue()->Entry(0)->albumArtUrl);

    // "total" decides, not the array: a favourite list with total 0 falls
    // through to the user-defined list, then to RadioIO.
    Radio("favorite.json", 0, {"Fav"});
    Radio("userdef.json", 1, {"User1", "User2"});
    ASSERT_EQ(0, ChangeSourceRadio(player));
    EXPECT_EQ((std::vector<std::string>{"User1", "User2"}), Titles());
    Radio("userdef.json", 0, {"User1"});
    Radio("radioio.json", 3, {"Io1", "Io2", "Io3"});
    ASSERT_EQ(0, ChangeSourceRadio(player));
    EXPECT_EQ((std::vector<std::string>{"Io1", "Io2", "Io3"}), Titles());
    // RadioIO with total 0: no list at all, silently.
    Radio("radioio.json", 0, {"Io1"});
    Marker();
    h.ClearLog();
    EXPECT_EQ(-1, ChangeSourceRadio(player));
    EXPECT_EQ(1, h.CountLog("Failed to get radio list for changing source."));
    EXPECT_EQ(0, h.CountLog("Failed to get RadioIO radio list."));
    EXPECT_TRUE(QueueIsMarker());

    // A non-zero total over an empty array: -1 without a message.
    Radio("favorite.json", 2, {});
    h.ClearLog();
    g_sourceType = 4;
    EXPECT_EQ(-1, ChangeSourceRadio(player));
    EXPECT_EQ(0, h.CountLog("changesrc:"));
    EXPECT_TRUE(QueueIsMarker());
    EXPECT_EQ(4, g_sourceType);

    // An unreadable favourite list stops the choice.
    ASSERT_EQ(0, h.WriteFile(TARN_RADIO_FAVORITE, "{broken"));
    h.ClearLog();
    EXPECT_EQ(-1, ChangeSourceRadio(player));
    EXPECT_EQ(1, h.CountLog("Failed to get favorite radio list."));
    ASSERT_EQ(0, unlink(h.Path(TARN_RADIO_FAVORITE).c_str()));
    ASSERT_EQ(0, h.WriteFile(TARN_RADIO_USERDEF, "[1"));
    // (no seed file either: the favourite list reads as empty)
    ASSERT_EQ(0, unlink(h.Path("/usr/tarn/etc/audio/default_radio_station.asx").c_str()));
    h.ClearLog();
    EXPECT_EQ(-1, ChangeSourceRadio(player));
    EXPECT_EQ(1, h.CountLog("Failed to get user-defined radio list."));
}

TEST_F(SourceChangeTest, IpodTrackList)
{
    Library(3);
    Marker();
    const char *list = "/usr/tarn/etc/audio/ipod/tracks.m3u";
    EXPECT_EQ(-1, ChangeSourceIPod(player));  // no list
    ASSERT_EQ(0, h.WriteFile(list, "#EXTM3U\n/nowhere/gone.mp3\n"));
    EXPECT_EQ(-1, ChangeSourceIPod(player));  // no playable track
    EXPECT_TRUE(QueueIsMarker());
    EXPECT_EQ(0, g_sourceType);

    ASSERT_EQ(0, h.WriteFile(list, "#EXTM3U\n" + music + "/song1.wav\n" + music + "/song0.wav\n"));
    ASSERT_EQ(0, ChangeSourceIPod(player));
    EXPECT_EQ(3, g_sourceType);
    EXPECT_EQ((std::vector<std::string>{music + "/song1.wav", music + "/song0.wav"}), Paths());
    // Library songs keep their ids but get no cover URL here.
    EXPECT_NE(0u, Queue()->Entry(0)->id);
    EXPECT_STREQ("", Queue()->Entry(0)->albumArtUrl);
}

TEST_F(SourceChangeTest, SavedPlaylistsFirstNextPreviousWithWrap)
{
    Library(0);
    Marker();
    h.ClearLog();
    EXPECT_EQ(-1, ChangeSourceFirstPlaylist(player));  // none saved: silent
    EXPECT_EQ(0, h.CountLog("changesrc:"));
    EXPECT_TRUE(QueueIsMarker());

    Song(h.Path("/outside/stray.wav"));  // not in the library: id 0
    Library(4, {{"a.m3u", "#PLAYLIST:Alpha\nsong0.wav\nsong1.wav\n"},
                {"b.m3u", "#PLAYLIST:Beta\nsong2.wav\n" + h.Path("/outside/stray.wav") + "\n"},
                {"c.m3u", "#PLAYLIST:Gamma\nsong3.wav\n"}});
    std::string a = music + "/a.m3u", b = music + "/b.m3u", c = music + "/c.m3u";

    ASSERT_EQ(0, ChangeSourceFirstPlaylist(player));
    EXPECT_EQ(4, g_sourceType);
    EXPECT_EQ(a, g_currentPlaylistPath);
    EXPECT_EQ((std::vector<std::string>{music + "/song0.wav", music + "/song1.wav"}), Paths());
    EXPECT_EQ(std::string(kCoverPrefix) + std::to_string(Queue()->Entry(0)->id) + ".jpg",
              Queue()->Entry(0)->albumArtUrl);

    ASSERT_EQ(0, ChangeSourceNext(player));
    EXPECT_EQ(b, g_currentPlaylistPath);
    ASSERT_EQ(2u, Queue()->Count());
    // The song outside the library has id 0 and an all-zero cover field.
    EXPECT_EQ(0u, Queue()->Entry(1)->id);
    const char *art = Queue()->Entry(1)->albumArtUrl;
    EXPECT_EQ(255, std::count(art, art + 255, '\0'));

    ASSERT_EQ(0, ChangeSourceNext(player));
    EXPECT_EQ(c, g_currentPlaylistPath);
    ASSERT_EQ(0, ChangeSourceNext(player));  // wraps to the first
    EXPECT_EQ(a, g_currentPlaylistPath);
    EXPECT_EQ((std::vector<std::string>{music + "/song0.wav", music + "/song1.wav"}), Paths());
    ASSERT_EQ(0, ChangeSourcePrevious(player));  // wraps to the last
    EXPECT_EQ(c, g_currentPlaylistPath);
    EXPECT_EQ((std::vector<std::string>{music + "/song3.wav"}), Paths());
    ASSERT_EQ(0, ChangeSourcePrevious(player));
    EXPECT_EQ(b, g_currentPlaylistPath);

    // A playlist whose songs are gone: next still moves to it and sets the
    // source, the queue keeps what it had.
    ASSERT_EQ(0, unlink((music + "/song3.wav").c_str()));
    h.ClearLog();
    ASSERT_EQ(0, ChangeSourceNext(player));
    EXPECT_EQ(c, g_currentPlaylistPath);
    EXPECT_EQ(4, g_sourceType);
    EXPECT_EQ(1, h.CountLog("Failed to get playlist [" + c + "]"));
    EXPECT_EQ(2u, Queue()->Count());

    // The current playlist vanished from the library: silent failure.
    ASSERT_EQ(0, unlink(c.c_str()));
    Rescan();
    h.ClearLog();
    EXPECT_EQ(-1, ChangeSourceNext(player));
    EXPECT_EQ(-1, ChangeSourcePrevious(player));
    EXPECT_EQ(0, h.CountLog("changesrc:"));

    // Source type 4 without a path.
    g_currentPlaylistPath[0] = '\0';
    EXPECT_EQ(-1, ChangeSourceNext(player));
    EXPECT_EQ(1, h.CountLog("source in playlist, but no path"));
}

TEST_F(SourceChangeTest, FirstPlaylistFailureNamesThePreviousPlaylist)
{
    Library(2, {{"a.m3u", "#PLAYLIST:Alpha\nsong0.wav\n"}, {"b.m3u", "#PLAYLIST:Beta\nsong1.wav\n"}});
    g_sourceType = 4;
    snprintf(g_currentPlaylistPath, sizeof(g_currentPlaylistPath), "%s", (music + "/b.m3u").c_str());
    ASSERT_EQ(0, unlink((music + "/song0.wav").c_str()));
    Marker();
    h.ClearLog();
    EXPECT_EQ(-1, ChangeSourceFirstPlaylist(player));
    EXPECT_EQ(1, h.CountLog("Failed to get playlist [" + music + "/a.m3u]"));
    EXPECT_EQ(1, h.CountLog("Failed to change source to playlist [" + music + "/b.m3u]"));
    EXPECT_TRUE(QueueIsMarker());
    EXPECT_EQ(music + "/b.m3u", g_currentPlaylistPath);
}

TEST_F(SourceChangeTest, NextAndPreviousByKindOfSource)
{
    Library(5);
    Marker();
    for (int type : {0, 2, 3, 6}) {
        g_sourceType = type;
        EXPECT_EQ(-1, ChangeSourceNext(player)) << type;
        EXPECT_EQ(-1, ChangeSourcePrevious(player)) << type;
        EXPECT_TRUE(QueueIsMarker());
        EXPECT_EQ(type, g_sourceType);
    }
    g_sourceType = 1;
    ASSERT_EQ(0, ChangeSourceNext(player));
    EXPECT_EQ(5u, Queue()->Count());
    Marker();
    ASSERT_EQ(0, ChangeSourcePrevious(player));
    EXPECT_EQ(5u, Queue()->Count());
    EXPECT_EQ(1, g_sourceType);
}

TEST_F(SourceChangeTest, CustomSlotsLoadEveryKind)
{
    Library(3, {{"a.m3u", "#PLAYLIST:Alpha\nsong2.wav\nsong0.wav\n"}});
    MediaLib lib;
    ASSERT_EQ(0, lib.Open(MediaLibDefaultPath(), false));
    SmartPlaylist smart;
    smart.name = "Ones";
    SmartRule rule;
    std::string why;
    ASSERT_EQ(0, SmartRuleParse("path contains song1", &rule, &why)) << why;
    smart.rules.push_back(rule);
    ASSERT_EQ(0, lib.SaveSmart(smart)) << lib.LastError();
    lib.Close();

    ASSERT_EQ(0, TARNAudioCustomSet(1, "playlist", music + "/a.m3u", "Alpha"));
    ASSERT_EQ(0, TARNAudioCustomSet(2, "smart", "Ones", ""));
    ASSERT_EQ(0, TARNAudioCustomSet(3, "radio", "http://radio/slot", "Slot FM"));
    ASSERT_EQ(0, TARNAudioCustomSet(4, "Radio", "http://radio/x", "X"));
    ASSERT_EQ(0, TARNAudioCustomSet(5, "playlist", music + "/deleted.m3u", "Gone"));
    ASSERT_EQ(0, TARNAudioCustomSet(6, "smart", "ones", ""));

    Marker();
    EXPECT_EQ(-1, ChangeSourceCustom(9, player));  // empty slot: silent
    EXPECT_TRUE(QueueIsMarker());
    EXPECT_EQ(0, g_sourceType);

    ASSERT_EQ(0, ChangeSourceCustom(1, player));
    EXPECT_EQ(6, g_sourceType);
    EXPECT_EQ((std::vector<std::string>{music + "/song2.wav", music + "/song0.wav"}), Paths());
    EXPECT_STREQ("", g_currentPlaylistPath);  // a slot does not set the path

    ASSERT_EQ(0, ChangeSourceCustom(2, player));
    EXPECT_EQ((std::vector<std::string>{music + "/song1.wav"}), Paths());
    EXPECT_EQ(std::string(kCoverPrefix) + std::to_string(Queue()->Entry(0)->id) + ".jpg",
              Queue()->Entry(0)->albumArtUrl);

    ASSERT_EQ(0, ChangeSourceCustom(3, player));
    EXPECT_EQ((std::vector<std::string>{"Slot FM"}), Titles());
    EXPECT_EQ((std::vector<std::string>{"http://radio/slot"}), Paths());

    // Type texts are compared exactly.
    g_sourceType = 2;
    h.ClearLog();
    EXPECT_EQ(-1, ChangeSourceCustom(4, player));
    EXPECT_EQ(1, h.CountLog("invalid custom type [Radio]"));
    EXPECT_EQ(2, g_sourceType);

    // Known types whose load fails still succeed and switch the source.
    Marker();
    g_sourceType = 1;
    h.ClearLog();
    EXPECT_EQ(0, ChangeSourceCustom(5, player));
    EXPECT_EQ(6, g_sourceType);
    EXPECT_TRUE(QueueIsMarker());
    EXPECT_EQ(1, h.CountLog("Failed to get playlist [" + music + "/deleted.m3u]"));
    EXPECT_EQ(-1, ChangeSourceNext(player));  // a slot has no next
    EXPECT_EQ(0, ChangeSourceCustom(6, player));
    EXPECT_EQ(1, h.CountLog("Failed to find Smart Playlist [ones]"));
    EXPECT_TRUE(QueueIsMarker());
}

TEST_F(SourceChangeTest, SaveCurrentSourceIntoASlot)
{
    Library(2, {{"a.m3u", "#PLAYLIST:Alpha Mix\nsong0.wav\n"}});
    ASSERT_EQ(0, h.Run({"/bin/mkdir", "-p", h.Path("/dev")}));
    std::string tty = "/dev/ttyS1";
    std::string t, s2, s3;

    // A random selection is not stored, and no signal is sent.
    ASSERT_EQ(0, ChangeSourceRandom100(player, true));
    EXPECT_EQ(0, SaveCustomSource(1, player));
    EXPECT_EQ(-1, TARNAudioCustomGet(1, t, s2, s3));
    EXPECT_FALSE(h.Exists(tty.c_str()));

    ASSERT_EQ(0, ChangeSourceFirstPlaylist(player));
    ASSERT_EQ(0, SaveCustomSource(1, player));
    ASSERT_EQ(0, TARNAudioCustomGet(1, t, s2, s3));
    EXPECT_EQ("playlist", t);
    EXPECT_EQ(music + "/a.m3u", s2);
    EXPECT_EQ("Alpha Mix", s3);
    EXPECT_EQ("2\n", h.ReadFile(tty.c_str()));
    ASSERT_EQ(0, unlink(h.Path(tty.c_str()).c_str()));

    // The stored slot loads back.
    Marker();
    ASSERT_EQ(0, ChangeSourceCustom(1, player));
    EXPECT_EQ((std::vector<std::string>{music + "/song0.wav"}), Paths());

    // Radio: the current station's URL and title.
    Radio("favorite.json", 2, {"One", "Two"});
    ASSERT_EQ(0, ChangeSourceRadio(player));
    ASSERT_EQ(0, Queue()->SetCurrent(1));
    ASSERT_EQ(0, SaveCustomSource(7, player));
    ASSERT_EQ(0, TARNAudioCustomGet(7, t, s2, s3));
    EXPECT_EQ("radio", t);
    EXPECT_EQ("http://radio/Two", s2);
    EXPECT_EQ("Two", s3);
    EXPECT_EQ("2\n", h.ReadFile(tty.c_str()));
    ASSERT_EQ(0, unlink(h.Path(tty.c_str()).c_str()));

    // Radio with an empty queue, or a playlist without a title: nothing.
    Queue()->Clear();
    EXPECT_EQ(-1, SaveCustomSource(8, player));
    g_sourceType = 4;
    snprintf(g_currentPlaylistPath, sizeof(g_currentPlaylistPath), "%s", "/nowhere.m3u");
    EXPECT_EQ(-1, SaveCustomSource(8, player));
    EXPECT_EQ(-1, TARNAudioCustomGet(8, t, s2, s3));
    EXPECT_FALSE(h.Exists(tty.c_str()));
    for (int type : {0, 3, 6}) {
        g_sourceType = type;
        EXPECT_EQ(0, SaveCustomSource(8, player));
    }
    EXPECT_EQ(-1, TARNAudioCustomGet(8, t, s2, s3));
}

}  // namespace
