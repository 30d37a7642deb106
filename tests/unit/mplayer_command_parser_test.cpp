// The command stream of mplayer-daemon as the daemon writes it: raw texts
// without terminators and NUL-padded 2048-byte buffers, split anywhere,
// glued together, mixed with garbage.
#include "tools/mplayer-daemon/command_parser.h"

#include <gtest/gtest.h>

#include <random>
#include <string>
#include <vector>

namespace {

std::string Padded(const std::string &text)
{
    std::string b(2048, '\0');
    return b.replace(0, text.size(), text);
}
std::string Load(const std::string &uri) { return "loadfile \"" + MplayerEscapeUri(uri) + "\""; }

// One command a line: "type:uri", "type:gains," or "type:value".
std::string Describe(const std::vector<MplayerCommand> &cmds)
{
    std::string s;
    for (const MplayerCommand &c : cmds) {
        s += std::to_string(c.type) + ":";
        if (c.type == MPCMD_LOADFILE)
            s += c.uri;
        else if (c.type == MPCMD_SETEQU)
            for (double g : c.gains)
                s += std::to_string(g) + ",";
        else
            s += std::to_string(c.value);
        s += ";";
    }
    return s;
}

std::string Parse(const std::string &stream, MplayerCommandParser *parser = nullptr)
{
    MplayerCommandParser own;
    MplayerCommandParser &p = parser ? *parser : own;
    std::vector<MplayerCommand> out;
    p.Feed(stream.data(), stream.size(), &out);
    p.Flush(&out);
    return Describe(out);
}

const std::string kSession =
    Load("/mnt/HD/Music/a b.mp3") + Padded("seek 70") + "pause" + Padded("setvol 35") + "pause" +
    Padded("mute") + Padded("setequ 1.5 -2.0 0.0 3.0 0.0 0.0 0.0 0.0 -4.5 12.0") +
    Load("http://radio.example/stream?x=1&y=\\2") + Padded("seek -5") + "quit";

TEST(MplayerCommandParser, SessionWholeSplitAnywhereAndByteByByte)
{
    std::string eq;
    for (double g : {1.5, -2.0, 0.0, 3.0, 0.0, 0.0, 0.0, 0.0, -4.5, 12.0})
        eq += std::to_string(g) + ",";
    const std::string want = std::to_string(MPCMD_LOADFILE) + ":/mnt/HD/Music/a b.mp3;" +
        std::to_string(MPCMD_SEEK) + ":70;" + std::to_string(MPCMD_PAUSE) + ":0;" +
        std::to_string(MPCMD_SETVOL) + ":35;" + std::to_string(MPCMD_PAUSE) + ":0;" +
        std::to_string(MPCMD_MUTE) + ":0;" + std::to_string(MPCMD_SETEQU) + ":" + eq + ";" +
        std::to_string(MPCMD_LOADFILE) + ":http://radio.example/stream?x=1&y=\\2;" +
        std::to_string(MPCMD_SEEK) + ":-5;" + std::to_string(MPCMD_QUIT) + ":0;";
    ASSERT_EQ(want, Parse(kSession));

    // Cut into two reads at every byte, with and without the socket drained
    // (Flush) between them.
    for (bool drained : {false, true}) {
        for (size_t cut = 1; cut < kSession.size(); ++cut) {
            MplayerCommandParser p;
            std::vector<MplayerCommand> out;
            p.Feed(kSession.data(), cut, &out);
            if (drained)
                p.Flush(&out);
            p.Feed(kSession.data() + cut, kSession.size() - cut, &out);
            p.Flush(&out);
            ASSERT_EQ(want, Describe(out)) << "cut at " << cut << (drained ? " drained" : "");
            EXPECT_EQ(0u, p.GarbageBytes());
        }
    }
    MplayerCommandParser p;
    std::vector<MplayerCommand> out;
    for (char c : kSession)
        p.Feed(&c, 1, &out);
    p.Flush(&out);
    EXPECT_EQ(want, Describe(out));
    EXPECT_EQ(0u, p.Pending());
}

TEST(MplayerCommandParser, EscapedUrisAndRawCommandsBackToBack)
{
    const std::string L = std::to_string(MPCMD_LOADFILE) + ":";
    for (std::string uri : {"C:\\music\\x.mp3", "/a\\\\b/trailing\\", "/music/My \"Best\" Song.mp3",
                            "/music/quote at end\"", "/music/pause.mp3", "/music/quit/loadfile \"x\"",
                            "http://h/s?a=1&b=\xc3\xa9"}) {
        EXPECT_EQ(L + uri + ";" + std::to_string(MPCMD_SETVOL) + ":7;", Parse(Load(uri) + Padded("setvol 7")));
        EXPECT_EQ(L + uri + ";", Parse(Load(uri)));  // ended by the drained socket
    }
    const std::string P = std::to_string(MPCMD_PAUSE) + ":0;", Q = std::to_string(MPCMD_QUIT) + ":0;";
    EXPECT_EQ(P + P + Q + L + "/a.mp3;" + P + L + "/b.mp3;" + L + "/c.ogg;",
              Parse("pausepausequit" + Load("/a.mp3") + "pause" + Load("/b.mp3") + Load("/c.ogg")));
    EXPECT_EQ(L + "/x \"y\".mp3;" + Q, Parse(Load("/x \"y\".mp3") + "quit"));

    // An unfinished command waits for its rest, even across a drained socket.
    MplayerCommandParser p;
    EXPECT_EQ("", Parse("loadfile \"/music/long name", &p));
    EXPECT_GT(p.Pending(), 0u);
    EXPECT_EQ(L + "/music/long name.flac;", Parse(".flac\"", &p));
    EXPECT_EQ("", Parse("setvol 4", &p));
    EXPECT_EQ(std::to_string(MPCMD_SETVOL) + ":42;", Parse(Padded("2").substr(0, 100), &p));
}

TEST(MplayerCommandParser, GarbageMalformedAndEndlessInput)
{
    std::string stream = std::string("\x01\xff" "xyz garbage 123 \x7f", 19) + "pause" + "se" + "zz" +
                         Padded("setvol 20") + "paus" + "q" + Padded("mute") + "lo" + Load("/a.mp3") +
                         std::string(100, '\xee') + "quit";
    MplayerCommandParser p;
    EXPECT_EQ(std::to_string(MPCMD_PAUSE) + ":0;" + std::to_string(MPCMD_SETVOL) + ":20;" +
                  std::to_string(MPCMD_MUTE) + ":0;" + std::to_string(MPCMD_LOADFILE) + ":/a.mp3;" +
                  std::to_string(MPCMD_QUIT) + ":0;",
              Parse(stream, &p));
    EXPECT_GT(p.GarbageBytes(), 100u);
    EXPECT_EQ(0u, p.Pending());

    // seek and setvol without a number are no commands; setequ alone is flat.
    std::string flat;
    for (int i = 0; i < 10; ++i)
        flat += std::to_string(0.0) + ",";
    EXPECT_EQ(std::to_string(MPCMD_SETEQU) + ":" + flat + ";" + std::to_string(MPCMD_SEEK) + ":12;",
              Parse(Padded("seek") + Padded("setvol x") + Padded("setequ") + Padded("seek +12")));

    // A quote that never closes does not grow the buffer forever.
    MplayerCommandParser endless;
    std::vector<MplayerCommand> out;
    std::string chunk = "loadfile \"" + std::string(1000, 'a');
    for (int i = 0; i < 100; ++i)
        endless.Feed(chunk.data(), chunk.size(), &out);
    EXPECT_LT(endless.Pending(), 16384u);
    endless.Feed("\0quit", 5, &out);
    endless.Flush(&out);
    ASSERT_FALSE(out.empty());
    EXPECT_EQ(MPCMD_QUIT, out.back().type);
}

// Random sessions with random junk (no quote, backslash or letter a command
// word starts with) between commands, fed in random pieces: every command
// comes out, in order.
TEST(MplayerCommandParser, RandomJunkBetweenCommandsNeverLosesACommand)
{
    std::mt19937 rng(20261122);
    const std::string junkChars("abcdefghijknortuvwxyz0123456789 .,;:!?#%&()[]{}<>=\0\n\x01\x7f\x80\xfe", 57);
    auto junk = [&] {
        std::string j(rng() % 12, ' ');
        for (char &c : j)
            c = junkChars[rng() % junkChars.size()];
        return j;
    };
    const std::vector<std::string> uris = {"/mnt/HD/a.mp3", "/m/x \"y\" z.flac", "http://h:8000/s",
                                           "/m/back\\slash.ogg", "/m/pause quit.wav"};
    for (int round = 0; round < 300; ++round) {
        std::string stream, want;
        for (int k = 0, count = 1 + int(rng() % 8); k < count; ++k) {
            stream += junk();
            int v = int(rng() % 101);
            switch (rng() % 6) {
            case 0: stream += "pause"; want += std::to_string(MPCMD_PAUSE) + ":0;"; break;
            case 1: {
                const std::string &u = uris[rng() % uris.size()];
                stream += Load(u);
                want += std::to_string(MPCMD_LOADFILE) + ":" + u + ";";
                break;
            }
            case 2: stream += Padded("seek " + std::to_string(v - 50)); want += std::to_string(MPCMD_SEEK) + ":" + std::to_string(v - 50) + ";"; break;
            case 3: stream += Padded("setvol " + std::to_string(v)); want += std::to_string(MPCMD_SETVOL) + ":" + std::to_string(v) + ";"; break;
            case 4: stream += Padded("mute"); want += std::to_string(MPCMD_MUTE) + ":0;"; break;
            default: stream += "quit"; want += std::to_string(MPCMD_QUIT) + ":0;"; break;
            }
        }
        stream += junk();
        MplayerCommandParser p;
        std::vector<MplayerCommand> out;
        for (size_t at = 0, n; at < stream.size(); at += n) {
            n = std::min(stream.size() - at, size_t(1 + rng() % 3000));
            p.Feed(stream.data() + at, n, &out);
        }
        p.Flush(&out);
        ASSERT_EQ(want, Describe(out)) << "round " << round;
        EXPECT_LT(p.Pending(), 16u);
    }
}

TEST(MplayerArgs, GainsAndArgumentVector)
{
    double g[MPLAYER_EQ_BANDS];
    EXPECT_EQ(3, MplayerParseGains("-30 20 1.5", g));  // clamped to -24..12, rest 0
    EXPECT_EQ((std::vector<double>{-24, 12, 1.5, 0, 0, 0, 0, 0, 0, 0}), std::vector<double>(g, g + 10));
    EXPECT_EQ(10, MplayerParseGains("1:2:3:4:5:6:7:8:9:10:11", g));
    EXPECT_EQ(0, MplayerParseGains("", g));

    const char *v1[] = {"/usr/tarn/bin/mplayer-daemon", "/mnt/HD/a.mp3", "-loop", "0", "-daemon",
                        "-volume", "35", "-af", "equalizer=1.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0:-3.5"};
    MplayerArgs a;
    ASSERT_EQ(0, MplayerParseArgs(9, v1, &a));
    EXPECT_EQ("/mnt/HD/a.mp3", a.uri);
    EXPECT_TRUE(a.volume == 35 && a.loop == 0 && a.daemon && a.haveGains);
    EXPECT_EQ(-3.5, a.gains[9]);
    const char *v2[] = {"mplayer-daemon", "-volume", "250", "-x", "-af", "scaletempo,equalizer=5",
                        "http://h/s", "-daemon"};
    MplayerArgs b;
    ASSERT_EQ(0, MplayerParseArgs(8, v2, &b));
    EXPECT_EQ("http://h/s", b.uri);
    EXPECT_EQ(100, b.volume);
    EXPECT_EQ(5.0, b.gains[0]);
    const char *v3[] = {"mplayer-daemon", "/a.mp3", "-volume"};
    MplayerArgs c;
    EXPECT_EQ(-1, MplayerParseArgs(3, v3, &c));
    EXPECT_FALSE(c.haveGains);
}

}  // namespace
