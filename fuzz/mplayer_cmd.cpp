// Fuzz target: mplayer-daemon's command stream parser, its equalizer gain
// parser and its command line parser.
//
// The stream is fed in pieces whose lengths come from the input itself
// (byte 0 seeds the split), then flushed. Checked: the parser holds back no
// more than it was given, each command is of a known kind, gains stay in the
// equalizer's range, and feeding the same bytes in one piece yields the same
// commands as feeding them split (for streams without a loadfile, whose end
// depends on where the sender paused).
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "tools/mplayer-daemon/command_parser.h"

namespace {

void Check(const std::vector<MplayerCommand> &cmds)
{
    for (const MplayerCommand &c : cmds) {
        if (c.type < MPCMD_PAUSE || c.type > MPCMD_SETEQU) {
            fprintf(stderr, "mplayer_cmd: command type %d\n", c.type);
            abort();
        }
        for (double g : c.gains) {
            if (!(g >= MPLAYER_EQ_MIN_DB && g <= MPLAYER_EQ_MAX_DB)) {
                fprintf(stderr, "mplayer_cmd: gain %f out of range\n", g);
                abort();
            }
        }
    }
}

std::string Describe(const std::vector<MplayerCommand> &cmds)
{
    std::string s;
    for (const MplayerCommand &c : cmds) {
        char buf[64];
        snprintf(buf, sizeof(buf), "%d/%d/", c.type, c.value);
        s += buf + c.uri;
        for (double g : c.gains) {
            snprintf(buf, sizeof(buf), "/%.2f", g);
            s += buf;
        }
        s += ";";
    }
    return s;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    if (size < 1 || size > 64 * 1024)
        return 0;
    unsigned seed = data[0];
    const char *bytes = reinterpret_cast<const char *>(data + 1);
    size_t len = size - 1;

    // Split feed.
    MplayerCommandParser split;
    std::vector<MplayerCommand> a;
    size_t at = 0;
    while (at < len) {
        seed = seed * 1103515245u + 12345u;
        size_t piece = 1 + (seed >> 16) % 97;
        if (piece > len - at)
            piece = len - at;
        split.Feed(bytes + at, piece, &a);
        at += piece;
        if (split.Pending() > at) {
            fprintf(stderr, "mplayer_cmd: %zu bytes pending of %zu fed\n", split.Pending(), at);
            abort();
        }
    }
    split.Flush(&a);
    Check(a);

    // Whole feed.
    MplayerCommandParser whole;
    std::vector<MplayerCommand> b;
    whole.Feed(bytes, len, &b);
    whole.Flush(&b);
    Check(b);
    if (memmem(bytes, len, "loadfile", 8) == nullptr && Describe(a) != Describe(b)) {
        fprintf(stderr, "mplayer_cmd: split feed gave [%s], whole feed [%s]\n", Describe(a).c_str(),
                Describe(b).c_str());
        abort();
    }

    // The same text as gains and as a command line.
    std::string text(bytes, len);
    double gains[MPLAYER_EQ_BANDS];
    int n = MplayerParseGains(text.c_str(), gains);
    if (n < 0 || n > MPLAYER_EQ_BANDS)
        abort();
    for (int i = 0; i < n; i++) {
        if (!(gains[i] >= MPLAYER_EQ_MIN_DB && gains[i] <= MPLAYER_EQ_MAX_DB))
            abort();
    }
    std::vector<std::string> words;
    size_t start = 0;
    for (size_t i = 0; i <= text.size() && words.size() < 64; i++) {
        if (i == text.size() || text[i] == '\0' || text[i] == ' ') {
            words.push_back(text.substr(start, i - start));
            start = i + 1;
        }
    }
    std::vector<const char *> argv;
    argv.push_back("mplayer-daemon");
    for (const std::string &w : words)
        argv.push_back(w.c_str());
    argv.push_back(nullptr);
    MplayerArgs args;
    MplayerParseArgs(static_cast<int>(argv.size() - 1), argv.data(), &args);
    return 0;
}
