#include "tools/mplayer-daemon/command_parser.h"

#include <cmath>
#include <cstdlib>
#include <cstring>

namespace {

struct Word {
    const char *text;
    size_t len;
    int type;
};

const Word kWords[] = {
    {"pause", 5, MPCMD_PAUSE},
    {"quit", 4, MPCMD_QUIT},
    {"loadfile", 8, MPCMD_LOADFILE},
    {"seek", 4, MPCMD_SEEK},
    {"setvol", 6, MPCMD_SETVOL},
    {"mute", 4, MPCMD_MUTE},
    {"setequ", 6, MPCMD_SETEQU},
};

// Longest loadfile text (escaped URI) and argument list accepted before the
// bytes are treated as garbage; keeps the held-back data bounded.
const size_t kMaxUriBytes = 3 * 4096;
const size_t kMaxArgBytes = 512;
// Consumed bytes are dropped from the buffer once this many have piled up.
const size_t kCompactAt = 4096;

bool IsSeparator(char c)
{
    return c == '\0' || c == ' ' || c == '\t' || c == '\r' || c == '\n';
}

bool IsLineEnd(char c)
{
    return c == '\0' || c == '\r' || c == '\n';
}

double ClampGain(double v)
{
    if (std::isnan(v))
        return 0.0;
    if (v < MPLAYER_EQ_MIN_DB)
        return MPLAYER_EQ_MIN_DB;
    if (v > MPLAYER_EQ_MAX_DB)
        return MPLAYER_EQ_MAX_DB;
    return v;
}

}  // namespace

MplayerCommandParser::MplayerCommandParser() : pos_(0), garbage_(0) {}

void MplayerCommandParser::Feed(const char *data, size_t len, std::vector<MplayerCommand> *out)
{
    if (data && len > 0)
        buf_.append(data, len);
    Run(false, out);
}

void MplayerCommandParser::Flush(std::vector<MplayerCommand> *out)
{
    Run(true, out);
}

void MplayerCommandParser::Run(bool flush, std::vector<MplayerCommand> *out)
{
    for (;;) {
        while (pos_ < buf_.size() && IsSeparator(buf_[pos_]))
            ++pos_;
        if (pos_ >= buf_.size())
            break;
        size_t used = 0;
        MplayerCommand cmd;
        Result r = ParseAt(pos_, flush, &used, &cmd);
        if (r == NEED_MORE)
            break;
        if (r == BAD) {
            // Not a command here: drop one byte and look for the next
            // command word from the following one.
            ++garbage_;
            ++pos_;
            continue;
        }
        pos_ += used;
        if (out)
            out->push_back(cmd);
    }
    Compact();
}

void MplayerCommandParser::Compact()
{
    if (pos_ >= buf_.size()) {
        buf_.clear();
        pos_ = 0;
    } else if (pos_ >= kCompactAt) {
        buf_.erase(0, pos_);
        pos_ = 0;
    }
}

int MplayerCommandParser::WordAt(size_t at, int *type, size_t *wordLen) const
{
    size_t avail = buf_.size() - at;
    bool partial = false;
    for (const Word &w : kWords) {
        size_t n = avail < w.len ? avail : w.len;
        if (memcmp(buf_.data() + at, w.text, n) != 0)
            continue;
        if (n == w.len) {
            *type = w.type;
            *wordLen = w.len;
            return 1;
        }
        partial = true;
    }
    return partial ? 0 : -1;
}

bool MplayerCommandParser::LoadfileAt(size_t at) const
{
    if (buf_.compare(at, 8, "loadfile") != 0)
        return false;
    size_t i = at + 8;
    while (i < buf_.size() && (buf_[i] == ' ' || buf_[i] == '\t'))
        ++i;
    return i > at + 8 && i < buf_.size() && buf_[i] == '"';
}

MplayerCommandParser::Result MplayerCommandParser::ParseArgs(size_t at, const char *allowed,
                                                             size_t *end)
{
    size_t i = at;
    while (i < buf_.size() && buf_[i] != '\0' && strchr(allowed, buf_[i]) != nullptr) {
        if (i - at >= kMaxArgBytes)
            return BAD;
        ++i;
    }
    if (i >= buf_.size())
        return NEED_MORE;  // the value may go on in the next read
    *end = i;
    return DONE;
}

MplayerCommandParser::Result MplayerCommandParser::ParseAt(size_t at, bool flush, size_t *used,
                                                           MplayerCommand *cmd)
{
    int type = 0;
    size_t len = 0;
    int w = WordAt(at, &type, &len);
    if (w == 0)
        return NEED_MORE;
    if (w < 0)
        return BAD;
    cmd->type = type;
    switch (type) {
    case MPCMD_PAUSE:
    case MPCMD_QUIT:
    case MPCMD_MUTE:
        *used = len;
        return DONE;
    case MPCMD_LOADFILE:
        return ParseLoadfile(at, flush, used, cmd);
    case MPCMD_SEEK:
    case MPCMD_SETVOL: {
        size_t end = 0;
        Result r = ParseArgs(at + len, " \t+-0123456789.", &end);
        if (r != DONE)
            return r;
        std::string text = buf_.substr(at + len, end - at - len);
        if (text.find_first_of("0123456789") == std::string::npos)
            return BAD;
        cmd->value = static_cast<int>(strtol(text.c_str(), nullptr, 10));
        *used = end - at;
        return DONE;
    }
    case MPCMD_SETEQU: {
        size_t end = 0;
        Result r = ParseArgs(at + len, " \t+-0123456789.:,", &end);
        if (r != DONE)
            return r;
        std::string text = buf_.substr(at + len, end - at - len);
        MplayerParseGains(text.c_str(), cmd->gains);
        *used = end - at;
        return DONE;
    }
    default:
        return BAD;
    }
}

MplayerCommandParser::Result MplayerCommandParser::ParseLoadfile(size_t at, bool flush,
                                                                 size_t *used, MplayerCommand *cmd)
{
    size_t i = at + 8;
    while (i < buf_.size() && (buf_[i] == ' ' || buf_[i] == '\t'))
        ++i;
    if (i >= buf_.size())
        return NEED_MORE;
    if (buf_[i] != '"')
        return ParseBareUri(at, i, flush, used, cmd);
    return ParseQuotedUri(at, i + 1, flush, used, cmd);
}

MplayerCommandParser::Result MplayerCommandParser::ParseBareUri(size_t at, size_t start,
                                                                bool flush, size_t *used,
                                                                MplayerCommand *cmd)
{
    // Lenient form without quotes (typed by hand): up to the line end.
    const size_t size = buf_.size();
    size_t i = start;
    while (i < size && !IsLineEnd(buf_[i])) {
        if (i - start >= kMaxUriBytes)
            return BAD;
        ++i;
    }
    if (i >= size && !flush)
        return NEED_MORE;
    std::string uri = buf_.substr(start, i - start);
    while (!uri.empty() && (uri.back() == ' ' || uri.back() == '\t'))
        uri.pop_back();
    if (uri.empty())
        return BAD;
    cmd->uri = uri;
    *used = i - at;
    return DONE;
}

int MplayerCommandParser::QuoteClosesAt(size_t i, bool flush) const
{
    const size_t size = buf_.size();
    size_t j = i + 1;
    while (j < size && (buf_[j] == ' ' || buf_[j] == '\t'))
        ++j;
    if (j >= size)
        return flush ? 1 : -1;
    int type = 0;
    size_t len = 0;
    int w = IsLineEnd(buf_[j]) ? 1 : WordAt(j, &type, &len);
    if (w == 1 || (w == 0 && flush))
        return 1;
    if (w == 0)
        return -1;
    return 0;
}

MplayerCommandParser::Result MplayerCommandParser::ParseQuotedUri(size_t at, size_t start,
                                                                  bool flush, size_t *used,
                                                                  MplayerCommand *cmd)
{
    const size_t size = buf_.size();
    size_t i = start;
    std::string uri;
    // Where the URI would end if the last quote seen were the closing one:
    // used when the URI runs into a line end, the end of the data or the
    // length limit without a clear closing quote (garbage after the quote).
    size_t lastQuote = 0;
    size_t uriAtLastQuote = 0;
    bool sawQuote = false;
    bool ended = false;
    for (;;) {
        if (i >= size) {
            if (!flush || !sawQuote)
                return NEED_MORE;
            break;
        }
        if (i - start >= kMaxUriBytes) {
            if (!sawQuote)
                return BAD;
            break;
        }
        char c = buf_[i];
        if (c == '\\') {
            if (i + 1 >= size) {
                if (!flush || !sawQuote)
                    return NEED_MORE;
                break;
            }
            uri += '\\';
            i += (buf_[i + 1] == '\\') ? 2 : 1;
            continue;
        }
        if (c == 'l' && sawQuote && LoadfileAt(i)) {
            // The next loadfile: whatever came after the last quote was
            // garbage.
            break;
        }
        if (IsLineEnd(c)) {
            if (!sawQuote) {
                // The closing quote is missing; the URI still ends here.
                ended = true;
            }
            break;
        }
        if (c == '"') {
            // The closing quote, unless the URI goes on after it.
            int closes = QuoteClosesAt(i, flush);
            if (closes < 0)
                return NEED_MORE;
            if (closes > 0) {
                ++i;
                ended = true;
                break;
            }
            sawQuote = true;
            lastQuote = i;
            uriAtLastQuote = uri.size();
            uri += '"';
            ++i;
            continue;
        }
        uri += c;
        ++i;
    }
    if (!ended) {
        // What follows the last quote is not part of the URI; it is parsed
        // (and mostly skipped) as the next command.
        uri.resize(uriAtLastQuote);
        i = lastQuote + 1;
    }
    if (uri.empty())
        return BAD;
    cmd->uri = uri;
    *used = i - at;
    return DONE;
}

int MplayerParseGains(const char *text, double gains[MPLAYER_EQ_BANDS])
{
    int n = 0;
    for (int k = 0; k < MPLAYER_EQ_BANDS; ++k)
        gains[k] = 0.0;
    if (!text)
        return 0;
    const char *p = text;
    while (n < MPLAYER_EQ_BANDS) {
        while (*p == ' ' || *p == '\t' || *p == ':' || *p == ',')
            ++p;
        if (*p == '\0')
            break;
        char *e = nullptr;
        double v = strtod(p, &e);
        if (e == p)
            break;
        gains[n++] = ClampGain(v);
        p = e;
    }
    return n;
}

std::string MplayerEscapeUri(const std::string &uri)
{
    std::string out;
    out.reserve(uri.size() + 8);
    for (char c : uri) {
        if (c == '\\')
            out += "\\\\";
        else
            out += c;
    }
    return out;
}

int MplayerParseArgs(int argc, const char *const *argv, MplayerArgs *args)
{
    int rc = 0;
    for (int i = 1; i < argc; ++i) {
        const char *a = argv[i];
        if (!a || !*a)
            continue;
        bool hasValue = i + 1 < argc && argv[i + 1] != nullptr;
        if (strcmp(a, "-daemon") == 0) {
            args->daemon = true;
        } else if (strcmp(a, "-loop") == 0 || strcmp(a, "-volume") == 0 ||
                   strcmp(a, "-af") == 0) {
            if (!hasValue) {
                rc = -1;
                continue;
            }
            const char *v = argv[++i];
            if (strcmp(a, "-loop") == 0) {
                args->loop = static_cast<int>(strtol(v, nullptr, 10));
            } else if (strcmp(a, "-volume") == 0) {
                long vol = strtol(v, nullptr, 10);
                args->volume = vol < 0 ? 0 : (vol > 100 ? 100 : static_cast<int>(vol));
            } else {
                // A filter list "name=p1:p2,name2=..."; only the equalizer
                // is ours.
                const char *eq = strstr(v, "equalizer=");
                if (eq) {
                    std::string params(eq + strlen("equalizer="));
                    size_t comma = params.find(',');
                    if (comma != std::string::npos)
                        params.resize(comma);
                    MplayerParseGains(params.c_str(), args->gains);
                    args->haveGains = true;
                }
            }
        } else if (a[0] == '-') {
            // Unknown option: ignored on its own.
        } else if (args->uri.empty()) {
            args->uri = a;
        }
    }
    return rc;
}
