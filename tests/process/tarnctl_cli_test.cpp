// tarnctl against the real daemon, the real mplayer-daemon (null output) and
// a real media library in a temporary root: failures said with exit status
// 1, usage mistakes with 2, the playback verbs, adding from the library and
// the file system, playlists and slots, waiting and watching, and text
// fitted by display columns.
#include <gtest/gtest.h>

#include <json/json.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <clocale>
#include <cstdlib>
#include <cstring>
#include <cwchar>
#include <filesystem>
#include <fstream>
#include <functional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <taglib/fileref.h>
#include <taglib/tag.h>

#include "tests/harness/harness.h"

namespace fs = std::filesystem;

namespace {

struct Song {
    std::string file, title, artist, album;
    int seconds;
};

// A sine tone of the given length, tagged with TagLib.
bool MakeSong(const std::string &path, const Song &s)
{
    fs::create_directories(fs::path(path).parent_path());
    std::string cmd = "sox -q -n -r 8000 -c 1 -b 16 '" + path + "' synth " + std::to_string(s.seconds) +
                      " sine 440 >/dev/null 2>&1";
    if (system(cmd.c_str()) != 0)
        return false;
    TagLib::FileRef f(path.c_str());
    if (f.isNull() || !f.tag())
        return false;
    f.tag()->setTitle(TagLib::String(s.title, TagLib::String::UTF8));
    f.tag()->setArtist(TagLib::String(s.artist, TagLib::String::UTF8));
    f.tag()->setAlbum(TagLib::String(s.album, TagLib::String::UTF8));
    return f.save();
}

// Decodes UTF-8 strictly; false on any invalid sequence. Width by wcwidth.
bool Utf8Width(const std::string &s, int *width)
{
    mbstate_t st;
    memset(&st, 0, sizeof(st));
    *width = 0;
    for (size_t i = 0; i < s.size();) {
        wchar_t wc;
        size_t n = mbrtowc(&wc, s.data() + i, s.size() - i, &st);
        if (n == static_cast<size_t>(-1) || n == static_cast<size_t>(-2) || n == 0)
            return false;
        int w = wcwidth(wc);
        *width += w < 0 ? 0 : w;
        i += n;
    }
    return true;
}

std::vector<std::string> Lines(const std::string &text)
{
    std::vector<std::string> out;
    std::istringstream in(text);
    for (std::string l; std::getline(in, l);)
        out.push_back(l);
    return out;
}

class TarnctlTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run";
        setlocale(LC_CTYPE, "C.UTF-8");
        setenv("COLUMNS", "80", 1);
        music = h.Root() + "/music";
        // Path order differs from tag order on purpose.
        songs = {
            {"b-side/01 first.flac", "Alpha", "Ann", "One", 30},
            {"b-side/02 second.flac", "Beta", "Bob", "One", 30},
            {"a-side/03 third.flac", "Gamma", "Ann", "Two", 30},
        };
        for (const Song &s : songs)
            ASSERT_TRUE(MakeSong(music + "/" + s.file, s)) << s.file;
        std::string out;
        ASSERT_EQ(0, h.Run({tarntest::BinPath("tarnlib"), "scan", music}, &out)) << out;
        ASSERT_EQ(0, h.Start()) << h.Error();
    }

    // Runs tarnctl; its exit status, stdout and stderr in *out.
    int Ctl(const std::vector<std::string> &args, std::string *out = nullptr)
    {
        std::vector<std::string> argv = {tarntest::BinPath("tarnctl")};
        argv.insert(argv.end(), args.begin(), args.end());
        std::string text;
        int rc = h.Run(argv, &text, 20000);
        if (out)
            *out = text;
        return rc;
    }
    std::string Out(const std::vector<std::string> &args)
    {
        std::string out;
        EXPECT_EQ(0, Ctl(args, &out)) << out;
        return out;
    }
    std::string Format(const std::string &fmt) { return Out({"status", "--format", fmt}); }
    Json::Value QueueJson()
    {
        std::string out = Out({"--json", "queue"});
        Json::Value v;
        Json::Reader().parse(out, v);
        return v;
    }

    tarntest::Harness h;
    std::string music;
    std::vector<Song> songs;
};

// Usage mistakes: exit status 2 and the one usage line of the command.
TEST_F(TarnctlTest, UsageMistakesShowTheCommandsUsageLine)
{
    struct Case {
        std::vector<std::string> args;
        std::string usage;
    } cases[] = {
        {{"seek"}, "usage: tarnctl seek [+-]SECONDS|[+-]MM:SS|PERCENT%"},
        {{"seek", "1:75"}, "usage: tarnctl seek "},
        {{"seek", "soon"}, "usage: tarnctl seek "},
        {{"volume", "loud"}, "usage: tarnctl volume [[+-]N]"},
        {{"repeat", "sometimes"}, "usage: tarnctl repeat [off|one|all]"},
        {{"shuffle", "maybe"}, "usage: tarnctl shuffle [on|off|toggle]"},
        {{"mute", "now"}, "usage: tarnctl mute [on|off|toggle]"},
        {{"play", "first"}, "usage: tarnctl play [POS]"},
        {{"queue", "insert", "x"}, "usage: tarnctl queue insert POS FILE|URL"},
        {{"slot", "save"}, "usage: tarnctl slot save N"},
        {{"status", "--format"}, "usage: tarnctl status [--format FORMAT]"},
        {{"status", "--format", "%nope%"}, "unknown field %nope%"},
        {{"stop", "--now"}, "usage: tarnctl stop"},
        {{"add"}, "usage: tarnctl add FILE|FOLDER|M3U|URL..."},
        {{"eq", "1", "2"}, "usage: tarnctl eq G1"},
    };
    for (const Case &c : cases) {
        std::string out;
        EXPECT_EQ(2, Ctl(c.args, &out)) << c.args[0] << ": " << out;
        EXPECT_NE(std::string::npos, out.find(c.usage)) << out;
        EXPECT_LE(Lines(out).size(), 2u) << "one message and one usage line: " << out;
    }
    std::string out;
    EXPECT_EQ(2, Ctl({"frobnicate"}, &out));
    EXPECT_NE(std::string::npos, out.find("unknown command 'frobnicate'")) << out;
    EXPECT_LE(Lines(out).size(), 1u) << out;
    EXPECT_EQ(0, Ctl({"help", "seek"}, &out));
    EXPECT_NE(std::string::npos, out.find("usage: tarnctl seek")) << out;
    EXPECT_NE(std::string::npos, out.find("50% is the middle")) << out;
    EXPECT_EQ(0, Ctl({"--help"}, &out));
    EXPECT_NE(std::string::npos, out.find("Exit status: 0 done; 1 refused or failed")) << out;
    EXPECT_EQ(0, Ctl({"--version"}, &out));
    EXPECT_EQ(0u, out.find("tarnctl ")) << out;
}

// Every refused or impossible request says why and exits with status 1,
// and changes nothing.
TEST_F(TarnctlTest, FailuresAreSaidWithExitStatusOne)
{
    std::ofstream(h.Root() + "/notes.txt") << "not a song";
    fs::create_directories(h.Root() + "/empty");
    struct Case {
        std::vector<std::string> args;
        std::string says;
    } emptyQueue[] = {
        {{"play"}, "the queue is empty"},
        {{"next"}, "the queue is empty"},
        {{"seek", "10"}, "nothing is playing"},
        {{"mute", "on"}, "nothing is playing"},
        {{"volume", "150"}, "out of range: 0 to 100"},
        {{"source", "radio"}, "no station lists found"},
        {{"source", "ipod"}, "no iPod track list found"},
        {{"source", "playlist"}, "no saved playlist"},
        {{"source", "custom", "7"}, "custom slot 7 is empty"},
        {{"slot", "load", "7"}, "custom slot 7 is empty"},
        {{"slot", "save", "99"}, "there is no custom slot 99"},
        {{"select", "3"}, "there is no renderer 3"},
        {{"eq", "99", "0", "0", "0", "0", "0", "0", "0", "0", "0"}, "out of range"},
        {{"add", h.Root() + "/missing.mp3"}, "No such file or directory"},
        {{"add", h.Root() + "/notes.txt"}, "not a kind of song the player can play"},
        {{"add", h.Root() + "/empty"}, "no playable songs in this folder"},
        {{"search", "artist", "Nobody"}, "no songs of the library match"},
        {{"load", "Nothing"}, "no playlist named 'Nothing'"},
        {{"save", "x"}, "the queue is empty"},
    };
    for (const Case &c : emptyQueue) {
        std::string out;
        EXPECT_EQ(1, Ctl(c.args, &out)) << c.args[0] << ": " << out;
        EXPECT_NE(std::string::npos, out.find(c.says)) << c.args[0] << " " << c.args.back() << ": " << out;
    }
    EXPECT_EQ(0, QueueJson()["total"].asInt()) << "a refused add adds nothing";

    ASSERT_EQ(0, Ctl({"add", music + "/a-side"}));
    // A random selection cannot be stored in a slot: the slot file is untouched.
    Case oneSong[] = {
        {{"play", "99"}, "there is no song 99: the queue has 1 song"},
        {{"play", "-1"}, "there is no song -1"},
        {{"play", "0"}, "there is no song 0"},
        {{"queue", "remove", "99"}, "there is no song 99"},
        {{"queue", "current", "99"}, "there is no song 99"},
        {{"queue", "insert", "-5", music + "/a-side/03 third.flac"}, "cannot insert at -5: positions are 1 to 2"},
        {{"next"}, "song 1 is the last of the queue"},
        {{"prev"}, "song 1 is the first of the queue"},
        {{"add", "--bogus"}, "unknown option '--bogus'"},
    };
    for (const Case &c : oneSong) {
        std::string out;
        int rc = Ctl(c.args, &out);
        EXPECT_EQ(c.args[0] == "add" ? 2 : 1, rc) << c.args[0] << ": " << out;
        EXPECT_NE(std::string::npos, out.find(c.says)) << out;
    }
    EXPECT_EQ(1, QueueJson()["total"].asInt());
    std::string out;
    ASSERT_EQ(0, Ctl({"source", "random"}, &out)) << out;
    EXPECT_EQ(1, Ctl({"slot", "save", "2"}, &out));
    EXPECT_NE(std::string::npos, out.find("cannot be stored in a slot")) << out;
    EXPECT_FALSE(h.Exists("/usr/tarn/etc/audio/custom_slots.json"));
    ASSERT_EQ(0, Ctl({"stop"}, &out)) << out;

    // The player program missing: the daemon keeps why, play says it.
    ASSERT_EQ(0, unlink(h.Path(TARN_MPLAYER_BIN).c_str()));
    EXPECT_EQ(1, Ctl({"play", "1"}, &out));
    EXPECT_NE(std::string::npos, out.find("cannot start the player program")) << out;
    EXPECT_NE(std::string::npos, Out({"status"}).find("error: cannot start the player program"));

    // Not allowed to reach the socket (the root folder is private to its
    // owner), then not running: two different messages.
    std::vector<std::string> asNobody = {"setpriv", "--reuid=65534", "--regid=65534", "--clear-groups"};
    std::vector<std::string> probe = asNobody;
    probe.push_back("true");
    if (getuid() == 0 && h.Run(probe) == 0) {
        asNobody.push_back(tarntest::BinPath("tarnctl"));
        asNobody.push_back("status");
        EXPECT_EQ(1, h.Run(asNobody, &out));
        EXPECT_NE(std::string::npos, out.find("permission denied")) << out;
    }
    EXPECT_EQ(0, h.Stop());
    EXPECT_EQ(1, Ctl({"status"}, &out));
    EXPECT_NE(std::string::npos, out.find("tarnaudiod is not running")) << out;
    EXPECT_EQ(1, Ctl({"wait"}, &out));
    EXPECT_NE(std::string::npos, out.find("tarnaudiod is not running")) << out;
}

// The familiar verbs through the real player: play never pauses, pause and
// shuffle are idempotent, seek and volume take relative values, mute and
// the modes show their state, positions are 1-based.
TEST_F(TarnctlTest, PlaybackVerbsBehaveAsPeopleExpect)
{
    std::string out;
    ASSERT_EQ(0, Ctl({"add", music}, &out)) << out;
    EXPECT_NE(std::string::npos, out.find("added 3 songs (the queue has 3)")) << out;
    ASSERT_EQ(0, Ctl({"play", "2"}, &out)) << out;
    EXPECT_NE(std::string::npos, out.find("[playing] #2/3")) << out;
    EXPECT_EQ("playing|Alpha|Ann|One|2|3|0:30\n", Format("%state%|%title%|%artist%|%album%|%position%|%length%|%time%"));
    EXPECT_EQ("Ann - Alpha\n", Out({"current"}));
    EXPECT_EQ(1, QueueJson()["current"].asInt()) << "--json keeps the daemon's 0-based index";

    struct Step {
        std::vector<std::string> args;
        std::string format, expect;
    } steps[] = {
        {{"play"}, "%state% %position%", "playing 2"},  // play while playing does not pause
        {{"pause"}, "%state%", "paused"},
        {{"pause"}, "%state%", "paused"},
        {{"toggle"}, "%state%", "playing"},
        {{"volume", "40"}, "%volume%", "40"},
        {{"volume", "+10"}, "%volume%", "50"},
        {{"volume", "-70"}, "%volume%", "0"},
        {{"mute", "on"}, "%mute%", "on"},
        {{"mute", "on"}, "%mute%", "on"},
        {{"mute", "toggle"}, "%mute%", "off"},
        {{"repeat", "all"}, "%repeat% %shuffle%", "all off"},
        {{"repeat", "one"}, "%repeat% %shuffle%", "one off"},
        {{"shuffle", "on"}, "%repeat% %shuffle%", "off on"},
        {{"shuffle", "on"}, "%repeat% %shuffle%", "off on"},
        {{"shuffle", "off"}, "%shuffle%", "off"},
        {{"repeat", "off"}, "%repeat%", "off"},
    };
    for (const Step &s : steps) {
        ASSERT_EQ(0, Ctl(s.args, &out)) << s.args[0] << ": " << out;
        EXPECT_EQ(s.expect + "\n", Format(s.format)) << s.args[0] << " " << s.args.back();
    }
    EXPECT_NE(std::string::npos, Out({"mute"}).find("mute: off"));

    // Seek: absolute, relative both ways, minutes, percent.
    struct Seek {
        std::string to;
        int at;
    } seeks[] = {{"10", 10}, {"+5", 15}, {"-3", 12}, {"0:20", 20}, {"50%", 15}};
    for (const Seek &s : seeks) {
        ASSERT_EQ(0, Ctl({"seek", s.to}, &out)) << s.to << ": " << out;
        int at = atoi(Format("%elapsed%").substr(2).c_str());
        EXPECT_NEAR(s.at, at, 2) << s.to;
    }
    EXPECT_EQ(1, Ctl({"seek", "5:00"}, &out));
    EXPECT_NE(std::string::npos, out.find("the song is only 0:30 long")) << out;

    ASSERT_EQ(0, Ctl({"next"}, &out)) << out;
    EXPECT_EQ("playing 3\n", Format("%state% %position%"));
    ASSERT_EQ(0, Ctl({"prev"}, &out)) << out;
    EXPECT_EQ("playing 2\n", Format("%state% %position%"));
    ASSERT_EQ(0, Ctl({"stop"}, &out)) << out;
    EXPECT_EQ("stopped\n", Format("%state%"));
    EXPECT_EQ("", Out({"current"})) << "nothing plays";
    ASSERT_EQ(0, Ctl({"next"}, &out)) << out;
    EXPECT_EQ("stopped 3\n", Format("%state% %position%")) << "next while stopped moves the current song";

    // A stream nobody serves: mplayer-daemon reports why, play says it,
    // status keeps it.
    ASSERT_EQ(0, Ctl({"add", "http://127.0.0.1:9/none.mp3"}, &out)) << out;
    EXPECT_EQ(1, Ctl({"play", "4"}, &out));
    EXPECT_NE(std::string::npos, out.find("cannot play http://127.0.0.1:9/none.mp3: ")) << out;
    EXPECT_NE(std::string::npos, Out({"status"}).find("error: cannot play http://127.0.0.1:9/none.mp3"));
    // A song whose file went away after it was queued: said before sending.
    fs::remove(music + "/a-side/03 third.flac");
    EXPECT_EQ(1, Ctl({"play", "1"}, &out));
    EXPECT_NE(std::string::npos, out.find("cannot play song 1: ")) << out;
    EXPECT_NE(std::string::npos, out.find("No such file or directory")) << out;
}

// Adding from the file system and the library: records carry the library's
// tags and ids, or the file's own tags; folders in path order; playlists
// saved, listed and loaded by name; slots stored from a playlist source.
TEST_F(TarnctlTest, LibraryAtHand)
{
    std::string out;
    std::string loose = h.Root() + "/loose/x.flac";
    ASSERT_TRUE(MakeSong(loose, {"", "Xavier", "Loose", "Solo", 2}));
    ASSERT_EQ(0, Ctl({"add", music, loose, "http://127.0.0.1:9/radio"}, &out)) << out;
    Json::Value q = QueueJson();
    ASSERT_EQ(5, q["total"].asInt()) << out;
    struct Want {
        std::string title, artist, album;
        int duration;
        bool inLibrary;
    } want[] = {
        {"Gamma", "Ann", "Two", 30, true},  // a-side comes first in path order
        {"Alpha", "Ann", "One", 30, true},
        {"Beta", "Bob", "One", 30, true},
        {"Xavier", "Loose", "Solo", 2, false},  // the file's own tags
        {"radio", "", "", 0, false},
    };
    for (int i = 0; i < 5; ++i) {
        const Json::Value &u = q["uris"][i];
        EXPECT_EQ(want[i].title, u["title"].asString()) << i;
        EXPECT_EQ(want[i].artist, u["artist"].asString()) << i;
        EXPECT_EQ(want[i].album, u["album"].asString()) << i;
        EXPECT_EQ(want[i].duration, u["duration"].asInt()) << i;
        EXPECT_EQ(want[i].inLibrary, u["item_id"].asString() != "playing@0") << i << u["item_id"];
    }

    out = Out({"search", "artist", "ann"});
    EXPECT_EQ(2u, Lines(out).size()) << out;
    EXPECT_NE(std::string::npos, out.find("Gamma")) << out;
    out = Out({"search", "one", "beta"});
    EXPECT_EQ(1u, Lines(out).size()) << out;
    EXPECT_EQ("a-side/\nb-side/\n", Out({"ls"}));
    EXPECT_EQ("b-side/01 first.flac\nb-side/02 second.flac\n", Out({"ls", "b-side"}));

    ASSERT_EQ(0, Ctl({"clear"}, &out)) << out;
    ASSERT_EQ(0, Ctl({"ls", "b-side", "--add"}, &out)) << out;
    ASSERT_EQ(0, Ctl({"search", "title", "gamma", "--add"}, &out)) << out;
    q = QueueJson();
    ASSERT_EQ(3, q["total"].asInt());
    EXPECT_EQ("Gamma", q["uris"][2]["title"].asString());

    // save writes an M3U into the playlist folder; playlists shows it; load appends it.
    ASSERT_EQ(0, Ctl({"save", "Evening"}, &out)) << out;
    std::string m3u = music + "/playlists/Evening.m3u";
    ASSERT_TRUE(fs::exists(m3u)) << out;
    std::ifstream in(m3u);
    std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    EXPECT_NE(std::string::npos, text.find("#EXTINF:30,Ann - Alpha\n" + music + "/b-side/01 first.flac\n")) << text;
    EXPECT_EQ(1, Ctl({"save", "Evening"}, &out));
    EXPECT_NE(std::string::npos, out.find("exists already")) << out;
    EXPECT_NE(std::string::npos, Out({"playlists"}).find("Evening")) << "listed before any rescan";
    ASSERT_EQ(0, Ctl({"load", "evening"}, &out)) << out;
    EXPECT_EQ(6, QueueJson()["total"].asInt());
    ASSERT_EQ(0, Ctl({"add", m3u}, &out)) << out;
    EXPECT_EQ(9, QueueJson()["total"].asInt());

    // A scanned playlist as the source can be stored in a slot and loaded back.
    ASSERT_EQ(0, h.Run({tarntest::BinPath("tarnlib"), "scan", music}, &out)) << out;
    ASSERT_EQ(0, Ctl({"source", "playlist"}, &out)) << out;
    ASSERT_EQ(0, Ctl({"slot", "save", "3"}, &out)) << out;
    EXPECT_NE(std::string::npos, out.find("custom slot 3: playlist Evening")) << out;
    ASSERT_EQ(0, Ctl({"clear"}, &out)) << out;
    ASSERT_EQ(0, Ctl({"slot", "load", "3"}, &out)) << out;
    EXPECT_EQ(3, QueueJson()["total"].asInt());
}

// wait returns on a change and says what changed; watch keeps to the
// terminal's width and ends with a message when the daemon stops.
TEST_F(TarnctlTest, WaitAndWatch)
{
    std::string out;
    ASSERT_EQ(0, Ctl({"add", music}, &out)) << out;
    std::string waitOut = h.Root() + "/wait.out";
    pid_t waiter = h.Spawn({"/bin/sh", "-c", tarntest::BinPath("tarnctl") + " wait --timeout 20 > " + waitOut + " 2>&1"});
    std::this_thread::sleep_for(std::chrono::milliseconds(500));
    EXPECT_EQ(-1, h.WaitExit(waiter, 300)) << "nothing changed yet";
    ASSERT_EQ(0, Ctl({"volume", "+5"}, &out)) << out;
    EXPECT_EQ(0, h.WaitExit(waiter, 3000));
    std::ifstream w(waitOut);
    std::string said((std::istreambuf_iterator<char>(w)), std::istreambuf_iterator<char>());
    EXPECT_EQ("volume\n", said);
    EXPECT_EQ(1, Ctl({"wait", "--timeout", "1"}, &out));
    EXPECT_NE(std::string::npos, out.find("nothing changed within 1 s")) << out;

    ASSERT_EQ(0, Ctl({"play"}, &out)) << out;
    for (const char *cols : {"40", "80", "132"}) {
        setenv("COLUMNS", cols, 1);
        out = Out({"watch", "--count", "3", "--interval", "100"});
        std::vector<std::string> lines = Lines(out);
        ASSERT_EQ(3u, lines.size()) << out;
        for (const std::string &l : lines) {
            int width = 0;
            ASSERT_TRUE(Utf8Width(l, &width)) << l;
            EXPECT_LT(width, atoi(cols)) << l;
            EXPECT_EQ(0u, l.find("playing ")) << l;
        }
        if (std::string(cols) == "132") {
            EXPECT_NE(std::string::npos, lines[0].find("Ann - Gamma")) << lines[0];
        }
    }
    setenv("COLUMNS", "80", 1);
    std::string watchOut = h.Root() + "/watch.out";
    pid_t watcher = h.Spawn({"/bin/sh", "-c", tarntest::BinPath("tarnctl") + " watch --interval 100 > " + watchOut + " 2>&1"});
    std::this_thread::sleep_for(std::chrono::milliseconds(500));
    ASSERT_EQ(0, h.Stop());
    EXPECT_EQ(1, h.WaitExit(watcher, 5000));
    std::ifstream wo(watchOut);
    std::string watched((std::istreambuf_iterator<char>(wo)), std::istreambuf_iterator<char>());
    EXPECT_NE(std::string::npos, watched.find("tarnaudiod stopped")) << watched;
}

// Titles in several scripts keep the queue's columns aligned: widths by
// display columns, cuts between characters, valid UTF-8 only.
TEST_F(TarnctlTest, TextFitsByDisplayColumns)
{
    const std::vector<Song> titled = {
        {"w/1.flac", "Ünïcödé àccents everywhere in this long title", "Zoë", "A", 2},
        {"w/2.flac", "日本語のタイトルがとても長い曲名です本当に長い", "山田太郎", "A", 2},
        {"w/3.flac", "Cafe\xCC\x81 combining marks e\xCC\x81\xCC\x81\xCC\x81 and more text here", "Ame\xCC\x81lie", "A", 2},
        {"w/4.flac", "plain ascii", "x", "A", 2},
    };
    for (const Song &s : titled)
        ASSERT_TRUE(MakeSong(h.Root() + "/" + s.file, s));
    std::string out;
    ASSERT_EQ(0, Ctl({"add", h.Root() + "/w"}, &out)) << out;
    for (const char *cols : {"50", "61", "80", "120"}) {
        setenv("COLUMNS", cols, 1);
        out = Out({"queue"});
        std::vector<std::string> lines = Lines(out);
        ASSERT_EQ(5u, lines.size()) << out;
        int first = -1;
        for (size_t i = 1; i < lines.size(); ++i) {
            int width = 0;
            ASSERT_TRUE(Utf8Width(lines[i], &width)) << "invalid UTF-8: " << lines[i];
            if (first < 0)
                first = width;
            EXPECT_EQ(first, width) << cols << " columns: " << lines[i];
            EXPECT_LE(width, atoi(cols)) << lines[i];
            EXPECT_EQ(lines[i].size() - 4, lines[i].rfind("0:02")) << "time column aligned: " << lines[i];
        }
    }
    setenv("COLUMNS", "50", 1);
    out = Out({"queue"});
    EXPECT_NE(std::string::npos, out.find("\xE2\x80\xA6")) << "long titles end in an ellipsis";
}

}  // namespace
