// The command stream of mplayer-daemon as the daemon writes it: raw texts
// without terminators and NUL-padded 2048-byte buffers, split anywhere,
// glued together, mixed with garbage.
#include "tools/mplayer-daemon/command_parser.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

std::string Padded(const std::string &text) { return text + std::string(2048 - text.size(), '\0'); }
std::string Load(const std::string &uri) { return "loadfile \"" + MplayerEscapeUri(uri) + "\""; }

// "load:URI;", "seek:N;", "setequ:G,G,...;", "pause;" ...
std::string Describe(const std::vector<MplayerCommand> &cmds)
{
    std::string s;
    char g[32];
    for (const MplayerCommand &c : cmds) {
        switch (c.type) {
        case MPCMD_LOADFILE: s += "load:" + c.uri; break;
        case MPCMD_SEEK: s += "seek:" + std::to_string(c.value); break;
        case MPCMD_SETVOL: s += "setvol:" + std::to_string(c.value); break;
        case MPCMD_PAUSE: s += "pause"; break;
        case MPCMD_MUTE: s += "mute"; break;
        case MPCMD_QUIT: s += "quit"; break;
        case MPCMD_SETEQU:
            s += "setequ:";
            for (double v : c.gains)
                s += (snprintf(g, sizeof(g), "%g,", v), g);
            break;
        default: s += "?" + std::to_string(c.type);
        }
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

TEST(MplayerCommandParser, SessionWholeSplitAnywhereAndByteByByte)
{
    const std::string session =
        Load("/mnt/HD/Music/a b.mp3") + Padded("seek 70") + "pause" + Padded("setvol 35") + "pause" +
        Padded("mute") + Padded("setequ 1.5 -2.0 0.0 3.0 0.0 0.0 0.0 0.0 -4.5 12.0") +
        Load("http://radio.example/stream?x=1&y=\\2") + Padded("seek -5") + "quit";
    const std::string want = "load:/mnt/HD/Music/a b.mp3;seek:70;pause;setvol:35;pause;mute;"
                             "setequ:1.5,-2,0,3,0,0,0,0,-4.5,12,;load:http://radio.example/stream?x=1&y=\\2;"
                             "seek:-5;quit;";
    ASSERT_EQ(want, Parse(session));
    // Cut into two reads at every byte, with and without the socket drained
    // (Flush) between them.
    for (bool drained : {false, true}) {
        for (size_t cut = 1; cut < session.size(); ++cut) {
            MplayerCommandParser p;
            std::vector<MplayerCommand> out;
            p.Feed(session.data(), cut, &out);
            if (drained)
                p.Flush(&out);
            p.Feed(session.data() + cut, session.size() - cut, &out);
            p.Flush(&out);
            ASSERT_EQ(want, Describe(out)) << "cut at " << cut << (drained ? " drained" : "");
            EXPECT_EQ(0u, p.GarbageBytes());
        }
    }
    MplayerCommandParser p;
    std::vector<MplayerCommand> out;
    for (char c : session)
        p.Feed(&c, 1, &out);
    p.Flush(&out);
    EXPECT_EQ(want, Describe(out));
    EXPECT_EQ(0u, p.Pending());
}

TEST(MplayerCommandParser, EscapedUrisAndRawCommandsBackToBack)
{
    for (std::string uri : {"C:\\music\\x.mp3", "/a\\\\b/trailing\\", "/music/My \"Best\" Song.mp3",
                            "/music/quote at end\"", "/music/pause.mp3", "/music/quit/loadfile \"x\"",
                            "http://h/s?a=1&b=\xc3\xa9"}) {
        EXPECT_EQ("load:" + uri + ";setvol:7;", Parse(Load(uri) + Padded("setvol 7")));
        EXPECT_EQ("load:" + uri + ";", Parse(Load(uri)));  // ended by the drained socket
    }
    EXPECT_EQ("pause;pause;quit;load:/a.mp3;pause;load:/b.mp3;load:/c.ogg;",
              Parse("pausepausequit" + Load("/a.mp3") + "pause" + Load("/b.mp3") + Load("/c.ogg")));
    EXPECT_EQ("load:/x \"y\".mp3;quit;", Parse(Load("/x \"y\".mp3") + "quit"));

    // An unfinished command waits for its rest, even across a drained socket.
    MplayerCommandParser p;
    EXPECT_EQ("", Parse("loadfile \"/music/long name", &p));
    EXPECT_GT(p.Pending(), 0u);
    EXPECT_EQ("load:/music/long name.flac;", Parse(".flac\"", &p));
    EXPECT_EQ("", Parse("setvol 4", &p));
    EXPECT_EQ("setvol:42;", Parse(Padded("2").substr(0, 100), &p));
}

TEST(MplayerCommandParser, GarbageMalformedAndEndlessInput)
{
    MplayerCommandParser p;
    EXPECT_EQ("pause;setvol:20;mute;load:/a.mp3;quit;",
              Parse(std::string("\x01\xff" "xyz garbage 123 \x7f", 19) + "pause" + "se" + "zz" +
                        Padded("setvol 20") + "paus" + "q" + Padded("mute") + "lo" + Load("/a.mp3") +
                        std::string(100, '\xee') + "quit", &p));
    EXPECT_GT(p.GarbageBytes(), 100u);
    EXPECT_EQ(0u, p.Pending());
    // seek and setvol without a number are no commands; setequ alone is flat.
    EXPECT_EQ("setequ:0,0,0,0,0,0,0,0,0,0,;seek:12;",
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

    // Equalizer gains are clamped to -24..12 dB, missing ones are 0.
    double g[MPLAYER_EQ_BANDS];
    EXPECT_EQ(3, MplayerParseGains("-30 20 1.5", g));
    EXPECT_EQ((std::vector<double>{-24, 12, 1.5, 0, 0, 0, 0, 0, 0, 0}), std::vector<double>(g, g + 10));
    EXPECT_EQ(10, MplayerParseGains("1:2:3:4:5:6:7:8:9:10:11", g));
}

}  // namespace
