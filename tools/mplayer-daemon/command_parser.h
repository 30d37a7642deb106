// Command stream of mplayer-daemon.
//
// The daemon writes commands to mplayer-daemon's connection without any
// framing of its own. Two kinds are mixed on the same stream:
//   raw texts with no terminator:   pause   quit   loadfile "URI"
//   2048-byte buffers, NUL-padded:  seek N  setvol N  mute  setequ g1 ... g10
// In "loadfile" every backslash of the URI is doubled; a double quote inside
// the URI is written as it is.
//
// MplayerCommandParser turns that byte stream back into commands. Bytes may
// arrive split anywhere and several commands may arrive in one read. The
// known command words are the anchors: anything before a command word that
// is not one is skipped as garbage, NUL bytes and white space separate
// commands. A loadfile URI ends at a double quote that is followed by a NUL,
// a line end, the next command word or the end of what the sender wrote in
// one go (Flush); a quote followed by anything else belongs to the URI,
// unless no such end comes before a NUL, a line end or the next
// 'loadfile "': then the URI ends at the last quote seen.
#ifndef MPLAYER_COMMAND_PARSER_H
#define MPLAYER_COMMAND_PARSER_H

#include <cstddef>
#include <string>
#include <vector>

enum MplayerCmdType {
    MPCMD_PAUSE = 1,
    MPCMD_QUIT,
    MPCMD_LOADFILE,
    MPCMD_SEEK,
    MPCMD_SETVOL,
    MPCMD_MUTE,
    MPCMD_SETEQU,
};

#define MPLAYER_EQ_BANDS 10
// Gains the ten-band equalizer accepts, in dB.
#define MPLAYER_EQ_MIN_DB (-24.0)
#define MPLAYER_EQ_MAX_DB 12.0

struct MplayerCommand {
    int type = 0;
    int value = 0;                          // seek seconds, setvol volume
    std::string uri;                        // loadfile, unescaped
    double gains[MPLAYER_EQ_BANDS] = {0};   // setequ, clamped
};

class MplayerCommandParser {
public:
    MplayerCommandParser();

    // Appends bytes and moves every command they complete to out. A command
    // that is still incomplete waits for the next Feed.
    void Feed(const char *data, size_t len, std::vector<MplayerCommand> *out);

    // The sender has written everything it had (the socket is drained, or
    // closed): a loadfile whose closing quote is the last byte received is
    // complete now. Incomplete padded commands keep waiting.
    void Flush(std::vector<MplayerCommand> *out);

    // Bytes skipped as garbage since construction.
    size_t GarbageBytes() const { return garbage_; }
    // Bytes held back waiting for the rest of a command.
    size_t Pending() const { return buf_.size() - pos_; }

private:
    enum Result { DONE, NEED_MORE, BAD };

    void Run(bool flush, std::vector<MplayerCommand> *out);
    Result ParseAt(size_t at, bool flush, size_t *used, MplayerCommand *cmd);
    Result ParseLoadfile(size_t at, bool flush, size_t *used, MplayerCommand *cmd);
    // The URI of the loadfile at 'at' without quotes, from 'start' to the
    // line end.
    Result ParseBareUri(size_t at, size_t start, bool flush, size_t *used, MplayerCommand *cmd);
    // The URI of the loadfile at 'at' whose opening quote is just before
    // 'start'.
    Result ParseQuotedUri(size_t at, size_t start, bool flush, size_t *used, MplayerCommand *cmd);
    // At a double quote at i: 1 it closes the URI, 0 it belongs to the URI,
    // -1 more bytes are needed to tell.
    int QuoteClosesAt(size_t i, bool flush) const;
    Result ParseArgs(size_t at, const char *allowed, size_t *end);
    // 1 a whole command word starts at 'at', 0 the rest of the buffer is a
    // proper prefix of one, -1 neither.
    int WordAt(size_t at, int *type, size_t *wordLen) const;
    // "loadfile" with blanks and an opening quote starts at 'at'.
    bool LoadfileAt(size_t at) const;
    void Compact();

    std::string buf_;
    size_t pos_;
    size_t garbage_;
};

// Parses up to ten gains separated by blanks, ':' or ','. Missing values
// count as 0; each value is clamped to the equalizer's range. Returns the
// number of values read (0 when none).
int MplayerParseGains(const char *text, double gains[MPLAYER_EQ_BANDS]);

// "loadfile" escaping as the daemon does it (backslash doubled, everything
// else copied): used by tests and tools that talk to mplayer-daemon.
std::string MplayerEscapeUri(const std::string &uri);

// Command line of mplayer-daemon:
//   mplayer-daemon URI -loop 0 -daemon -volume N -af equalizer=g1:...:g10
// Options may come in any order; unknown options are ignored.
struct MplayerArgs {
    std::string uri;
    int volume = 100;
    bool haveGains = false;
    double gains[MPLAYER_EQ_BANDS] = {0};
    int loop = -1;
    bool daemon = false;
};

// Returns 0, or -1 when an option lacks its value (the rest is still used).
int MplayerParseArgs(int argc, const char *const *argv, MplayerArgs *args);

#endif
