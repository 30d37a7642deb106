// The command stream of mplayer-daemon as the daemon writes it: raw texts
// without terminators and NUL-padded 2048-byte buffers, split anywhere,
// glued together, mixed with garbage.
#include "tools/mplayer-daemon/command_parser.h"

#include <gtest/gtest.h>

#include <random>
#include <string>
#include <vector>

namespace {

// A padded command exactly as the daemon sends it.
std::string Padded(const std::string &text)
{
    std::string b(2048, '\0');
    b.replace(0, text.size(), text);
    return b;
}

std::string Load(const std::string &uri)
{
    return "loadfile \"" + MplayerEscapeUri(uri) + "\"";
}

// The stream the daemon would write for one session of commands.
std::string Session()
{
    return Load("/mnt/HD/Music/a b.mp3") + Padded("seek 70") + "pause" + Padded("setvol 35") +
           "pause" + Padded("mute") + Padded("setequ 1.5 -2.0 0.0 3.0 0.0 0.0 0.0 0.0 -4.5 12.0") +
           Load("http://radio.example/stream?x=1&y=\\2") + Padded("seek -5") + "quit";
}

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

std::vector<MplayerCommand> ParseWhole(const std::string &stream)
{
    MplayerCommandParser p;
    std::vector<MplayerCommand> out;
    p.Feed(stream.data(), stream.size(), &out);
    p.Flush(&out);
    return out;
}

TEST(MplayerCommandParser, SessionInOneRead)
{
    std::vector<MplayerCommand> cmds = ParseWhole(Session());
    ASSERT_EQ(cmds.size(), 10u);
    EXPECT_EQ(cmds[0].type, MPCMD_LOADFILE);
    EXPECT_EQ(cmds[0].uri, "/mnt/HD/Music/a b.mp3");
    EXPECT_EQ(cmds[1].type, MPCMD_SEEK);
    EXPECT_EQ(cmds[1].value, 70);
    EXPECT_EQ(cmds[2].type, MPCMD_PAUSE);
    EXPECT_EQ(cmds[3].type, MPCMD_SETVOL);
    EXPECT_EQ(cmds[3].value, 35);
    EXPECT_EQ(cmds[4].type, MPCMD_PAUSE);
    EXPECT_EQ(cmds[5].type, MPCMD_MUTE);
    EXPECT_EQ(cmds[6].type, MPCMD_SETEQU);
    const double want[10] = {1.5, -2.0, 0, 3.0, 0, 0, 0, 0, -4.5, 12.0};
    for (int i = 0; i < 10; ++i)
        EXPECT_DOUBLE_EQ(cmds[6].gains[i], want[i]) << "band " << i;
    EXPECT_EQ(cmds[7].type, MPCMD_LOADFILE);
    EXPECT_EQ(cmds[7].uri, "http://radio.example/stream?x=1&y=\\2");
    EXPECT_EQ(cmds[8].type, MPCMD_SEEK);
    EXPECT_EQ(cmds[8].value, -5);
    EXPECT_EQ(cmds[9].type, MPCMD_QUIT);
}

// The same stream cut into two reads at every byte, with and without the
// reader draining the socket between them, gives the same commands.
TEST(MplayerCommandParser, SplitAtEveryByteGivesSameCommands)
{
    const std::string stream = Session();
    const std::string want = Describe(ParseWhole(stream));
    for (size_t cut = 1; cut < stream.size(); ++cut) {
        MplayerCommandParser p;
        std::vector<MplayerCommand> out;
        p.Feed(stream.data(), cut, &out);
        p.Feed(stream.data() + cut, stream.size() - cut, &out);
        p.Flush(&out);
        ASSERT_EQ(Describe(out), want) << "cut at " << cut;
        EXPECT_EQ(p.GarbageBytes(), 0u);
    }
    // Drained between reads: only a cut right after a loadfile's closing
    // quote can be taken for the end (the daemon writes each command in one
    // write, so this does not happen on the real stream); everything else
    // waits for its rest.
    for (size_t cut = 1; cut < stream.size(); ++cut) {
        MplayerCommandParser p;
        std::vector<MplayerCommand> out;
        p.Feed(stream.data(), cut, &out);
        p.Flush(&out);
        p.Feed(stream.data() + cut, stream.size() - cut, &out);
        p.Flush(&out);
        ASSERT_EQ(Describe(out), want) << "cut at " << cut;
    }
}

TEST(MplayerCommandParser, ByteByByte)
{
    const std::string stream = Session();
    MplayerCommandParser p;
    std::vector<MplayerCommand> out;
    for (char c : stream)
        p.Feed(&c, 1, &out);
    p.Flush(&out);
    EXPECT_EQ(Describe(out), Describe(ParseWhole(stream)));
    EXPECT_EQ(p.Pending(), 0u);
}

TEST(MplayerCommandParser, RawCommandsBackToBack)
{
    std::vector<MplayerCommand> cmds =
        ParseWhole("pausepausequit" + Load("/a.mp3") + "pause" + Load("/b.mp3") + Load("/c.ogg"));
    ASSERT_EQ(cmds.size(), 7u);
    EXPECT_EQ(cmds[0].type, MPCMD_PAUSE);
    EXPECT_EQ(cmds[1].type, MPCMD_PAUSE);
    EXPECT_EQ(cmds[2].type, MPCMD_QUIT);
    EXPECT_EQ(cmds[3].uri, "/a.mp3");
    EXPECT_EQ(cmds[4].type, MPCMD_PAUSE);
    EXPECT_EQ(cmds[5].uri, "/b.mp3");
    EXPECT_EQ(cmds[6].uri, "/c.ogg");
}

TEST(MplayerCommandParser, EscapedUris)
{
    struct Case {
        std::string uri;
    } cases[] = {
        {"C:\\music\\x.mp3"},            // backslashes doubled on the wire
        {"/a\\\\b/trailing\\"},          // double and trailing backslash
        {"/music/My \"Best\" Song.mp3"}, // quotes copied as they are
        {"/music/quote at end\""},
        {"/music/pause.mp3"},            // command words inside the URI
        {"/music/quit/loadfile \"x\""},
        {"http://h/s?a=1&b=\xc3\xa9"},   // UTF-8
    };
    for (const Case &c : cases) {
        std::string stream = Load(c.uri) + Padded("setvol 7");
        std::vector<MplayerCommand> cmds = ParseWhole(stream);
        ASSERT_EQ(cmds.size(), 2u) << c.uri;
        EXPECT_EQ(cmds[0].type, MPCMD_LOADFILE);
        EXPECT_EQ(cmds[0].uri, c.uri);
        EXPECT_EQ(cmds[1].value, 7);
        // Alone, ended by the drained socket.
        cmds = ParseWhole(Load(c.uri));
        ASSERT_EQ(cmds.size(), 1u) << c.uri;
        EXPECT_EQ(cmds[0].uri, c.uri);
    }
}

TEST(MplayerCommandParser, QuoteFollowedByCommandWordEndsUri)
{
    std::vector<MplayerCommand> cmds = ParseWhole(Load("/x \"y\".mp3") + "quit");
    ASSERT_EQ(cmds.size(), 2u);
    EXPECT_EQ(cmds[0].uri, "/x \"y\".mp3");
    EXPECT_EQ(cmds[1].type, MPCMD_QUIT);
}

TEST(MplayerCommandParser, LoadfileWaitsForClosingQuote)
{
    MplayerCommandParser p;
    std::vector<MplayerCommand> out;
    std::string part = "loadfile \"/music/long name";
    p.Feed(part.data(), part.size(), &out);
    p.Flush(&out);
    EXPECT_TRUE(out.empty());
    EXPECT_GT(p.Pending(), 0u);
    p.Feed(".flac\"", 6, &out);
    p.Flush(&out);
    ASSERT_EQ(out.size(), 1u);
    EXPECT_EQ(out[0].uri, "/music/long name.flac");
}

TEST(MplayerCommandParser, GarbageIsSkippedAndSyncRecovered)
{
    std::string junk("\x01\xff" "xyz garbage 123 \x7f", 19);
    std::string stream = junk + "pause" + "se" + "zz" + Padded("setvol 20") + "paus" + "q" +
                         Padded("mute") + "lo" + Load("/a.mp3") + std::string(100, '\xee') + "quit";
    MplayerCommandParser p;
    std::vector<MplayerCommand> out;
    p.Feed(stream.data(), stream.size(), &out);
    p.Flush(&out);
    ASSERT_EQ(out.size(), 5u) << Describe(out);
    EXPECT_EQ(out[0].type, MPCMD_PAUSE);
    EXPECT_EQ(out[1].type, MPCMD_SETVOL);
    EXPECT_EQ(out[1].value, 20);
    EXPECT_EQ(out[2].type, MPCMD_MUTE);
    EXPECT_EQ(out[3].uri, "/a.mp3");
    EXPECT_EQ(out[4].type, MPCMD_QUIT);
    EXPECT_GT(p.GarbageBytes(), 100u);
    EXPECT_EQ(p.Pending(), 0u);
}

// Random sessions with random junk between (and right after) commands, fed
// in random pieces: every command comes out, in order. The junk holds no
// quote, backslash or letter a command word starts with.
TEST(MplayerCommandParser, RandomJunkBetweenCommandsNeverLosesACommand)
{
    std::mt19937 rng(20261122);
    const std::string junkChars("abcdefghijknortuvwxyz0123456789 .,;:!?#%&()[]{}<>=\0\n\x01\x7f\x80\xfe", 57);
    auto junk = [&] {
        std::string j;
        int n = static_cast<int>(rng() % 12);
        for (int i = 0; i < n; ++i)
            j += junkChars[rng() % junkChars.size()];
        return j;
    };
    const std::vector<std::string> uris = {"/mnt/HD/a.mp3", "/m/x \"y\" z.flac", "http://h:8000/s",
                                           "/m/back\\slash.ogg", "/m/pause quit.wav"};
    for (int round = 0; round < 300; ++round) {
        std::string stream, want;
        int count = 1 + static_cast<int>(rng() % 8);
        for (int k = 0; k < count; ++k) {
            stream += junk();
            switch (rng() % 6) {
            case 0:
                stream += "pause";
                want += "1:0;";
                break;
            case 1: {
                const std::string &u = uris[rng() % uris.size()];
                stream += Load(u);
                want += "3:" + u + ";";
                break;
            }
            case 2: {
                int v = static_cast<int>(rng() % 200) - 100;
                stream += Padded("seek " + std::to_string(v));
                want += "4:" + std::to_string(v) + ";";
                break;
            }
            case 3: {
                int v = static_cast<int>(rng() % 101);
                stream += Padded("setvol " + std::to_string(v));
                want += "5:" + std::to_string(v) + ";";
                break;
            }
            case 4:
                stream += Padded("mute");
                want += "6:0;";
                break;
            default:
                stream += "quit";
                want += "2:0;";
                break;
            }
        }
        stream += junk();
        MplayerCommandParser p;
        std::vector<MplayerCommand> out;
        size_t at = 0;
        while (at < stream.size()) {
            size_t n = std::min(stream.size() - at, static_cast<size_t>(1 + rng() % 3000));
            p.Feed(stream.data() + at, n, &out);
            at += n;
        }
        p.Flush(&out);
        ASSERT_EQ(Describe(out), want) << "round " << round;
        EXPECT_LT(p.Pending(), 16u);
    }
}

TEST(MplayerCommandParser, MalformedPaddedCommandsAreDropped)
{
    // seek and setvol without a number are no commands; setequ without
    // values means flat.
    std::vector<MplayerCommand> cmds =
        ParseWhole(Padded("seek") + Padded("setvol x") + Padded("setequ") + Padded("seek +12"));
    ASSERT_EQ(cmds.size(), 2u) << Describe(cmds);
    EXPECT_EQ(cmds[0].type, MPCMD_SETEQU);
    for (double g : cmds[0].gains)
        EXPECT_EQ(g, 0.0);
    EXPECT_EQ(cmds[1].type, MPCMD_SEEK);
    EXPECT_EQ(cmds[1].value, 12);
}

TEST(MplayerCommandParser, PaddedCommandWaitsForItsTerminator)
{
    MplayerCommandParser p;
    std::vector<MplayerCommand> out;
    p.Feed("setvol 4", 8, &out);
    p.Flush(&out);
    EXPECT_TRUE(out.empty());
    std::string rest = Padded("2").substr(0, 100);
    p.Feed(rest.data(), rest.size(), &out);
    ASSERT_EQ(out.size(), 1u);
    EXPECT_EQ(out[0].value, 42);
}

TEST(MplayerCommandParser, HeldBackDataStaysBounded)
{
    // An opening quote that never closes must not grow the buffer forever.
    MplayerCommandParser p;
    std::vector<MplayerCommand> out;
    std::string head = "loadfile \"";
    p.Feed(head.data(), head.size(), &out);
    std::string chunk(1000, 'a');
    for (int i = 0; i < 100; ++i)
        p.Feed(chunk.data(), chunk.size(), &out);
    EXPECT_LT(p.Pending(), 16384u);
    p.Feed("\0quit", 5, &out);
    p.Flush(&out);
    ASSERT_FALSE(out.empty());
    EXPECT_EQ(out.back().type, MPCMD_QUIT);
}

TEST(MplayerCommandParser, GainsAreClampedAndMissingOnesAreZero)
{
    double g[MPLAYER_EQ_BANDS];
    EXPECT_EQ(MplayerParseGains("-30 20 1.5", g), 3);
    EXPECT_DOUBLE_EQ(g[0], -24.0);
    EXPECT_DOUBLE_EQ(g[1], 12.0);
    EXPECT_DOUBLE_EQ(g[2], 1.5);
    for (int i = 3; i < MPLAYER_EQ_BANDS; ++i)
        EXPECT_DOUBLE_EQ(g[i], 0.0);
    EXPECT_EQ(MplayerParseGains("1:2:3:4:5:6:7:8:9:10:11", g), 10);
    EXPECT_DOUBLE_EQ(g[9], 10.0);
    EXPECT_EQ(MplayerParseGains("", g), 0);
}

TEST(MplayerArgs, DaemonVectorInAnyOrder)
{
    const char *v1[] = {"/usr/tarn/bin/mplayer-daemon", "/mnt/HD/a.mp3", "-loop", "0", "-daemon",
                        "-volume", "35", "-af",
                        "equalizer=1.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0:-3.5"};
    MplayerArgs a;
    EXPECT_EQ(MplayerParseArgs(9, v1, &a), 0);
    EXPECT_EQ(a.uri, "/mnt/HD/a.mp3");
    EXPECT_EQ(a.volume, 35);
    EXPECT_EQ(a.loop, 0);
    EXPECT_TRUE(a.daemon);
    EXPECT_TRUE(a.haveGains);
    EXPECT_DOUBLE_EQ(a.gains[0], 1.0);
    EXPECT_DOUBLE_EQ(a.gains[9], -3.5);

    const char *v2[] = {"mplayer-daemon", "-volume", "250", "-x", "-af", "scaletempo,equalizer=5",
                        "http://h/s", "-daemon"};
    MplayerArgs b;
    EXPECT_EQ(MplayerParseArgs(8, v2, &b), 0);
    EXPECT_EQ(b.uri, "http://h/s");
    EXPECT_EQ(b.volume, 100);
    EXPECT_DOUBLE_EQ(b.gains[0], 5.0);
    EXPECT_DOUBLE_EQ(b.gains[1], 0.0);

    const char *v3[] = {"mplayer-daemon", "/a.mp3", "-volume"};
    MplayerArgs c;
    EXPECT_EQ(MplayerParseArgs(3, v3, &c), -1);
    EXPECT_EQ(c.uri, "/a.mp3");
    EXPECT_EQ(c.volume, 100);
    EXPECT_FALSE(c.haveGains);
}

}  // namespace
