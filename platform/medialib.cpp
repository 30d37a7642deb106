// The media library database and its scanner.
#include "platform/medialib.h"

#include <sys/stat.h>
#include <taglib/audioproperties.h>
#include <taglib/fileref.h>
#include <taglib/tag.h>
#include <taglib/tpropertymap.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>

#include "platform/tarn_env.h"
#include "platform/tarn_log.h"

namespace fs = std::filesystem;

static const char kLogUnit[] = "medialib";
static const int kSchemaVersion = 1;
static const int kApplicationId = 0x5441524E;  // "TARN"

// ---------------------------------------------------------------------------
// Default location

static std::mutex g_pathLock;
static std::string g_defaultPath;

std::string MediaLibDefaultPath()
{
    std::lock_guard<std::mutex> lock(g_pathLock);
    if (!g_defaultPath.empty())
        return g_defaultPath;
    return TarnPath("/usr/tarn/var/medialib.db");
}

void MediaLibSetDefaultPath(const std::string &path)
{
    std::lock_guard<std::mutex> lock(g_pathLock);
    g_defaultPath = path;
}

static std::string LowerExt(const std::string &path)
{
    size_t slash = path.rfind('/');
    size_t dot = path.rfind('.');
    if (dot == std::string::npos || (slash != std::string::npos && dot < slash))
        return std::string();
    std::string ext = path.substr(dot + 1);
    for (char &c : ext)
        c = (char)tolower((unsigned char)c);
    return ext;
}

bool MediaLibIsAudioFile(const std::string &path)
{
    static const char *const kExts[] = {"mp3", "mp2", "flac", "ogg", "oga", "opus", "spx",
                                        "wav", "m4a", "m4b", "mp4", "aac", "alac", "wma",
                                        "asf", "aif", "aiff", "aifc", "ape", "mpc", "wv",
                                        "tta"};
    std::string ext = LowerExt(path);
    for (const char *e : kExts)
        if (ext == e)
            return true;
    return false;
}

bool MediaLibIsPlaylistFile(const std::string &path)
{
    std::string ext = LowerExt(path);
    return ext == "m3u" || ext == "m3u8";
}

// ---------------------------------------------------------------------------
// Text helpers

// Length of the longest prefix of s, at most max bytes, that ends on a UTF-8
// character boundary.
static size_t Utf8Cut(const std::string &s, size_t max)
{
    if (s.size() <= max)
        return s.size();
    size_t n = max;
    while (n > 0 && ((unsigned char)s[n] & 0xC0) == 0x80)
        n--;
    return n;
}

static void CopyText(char *dst, size_t size, const std::string &src)
{
    size_t n = Utf8Cut(src, size - 1);
    memcpy(dst, src.data(), n);
    dst[n] = '\0';
}

static bool ValidUtf8(const std::string &s)
{
    size_t i = 0, n = s.size();
    while (i < n) {
        unsigned char c = (unsigned char)s[i];
        int len;
        uint32_t cp;
        if (c < 0x80) {
            i++;
            continue;
        } else if ((c & 0xE0) == 0xC0) {
            len = 2;
            cp = c & 0x1F;
        } else if ((c & 0xF0) == 0xE0) {
            len = 3;
            cp = c & 0x0F;
        } else if ((c & 0xF8) == 0xF0) {
            len = 4;
            cp = c & 0x07;
        } else {
            return false;
        }
        if (i + len > n)
            return false;
        for (int k = 1; k < len; k++) {
            unsigned char d = (unsigned char)s[i + k];
            if ((d & 0xC0) != 0x80)
                return false;
            cp = (cp << 6) | (d & 0x3F);
        }
        if ((len == 2 && cp < 0x80) || (len == 3 && cp < 0x800) || (len == 4 && cp < 0x10000) ||
            cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF))
            return false;
        i += len;
    }
    return true;
}

void MediaSongToInfo(const MediaSong &song, TARN_MEDIA_INFO *info)
{
    memset(info, 0, sizeof(*info));
    info->id = song.id;
    CopyText(info->path, sizeof(info->path), song.path);
    info->track = song.track;
    info->disc = song.disc;
    info->year = song.year;
    CopyText(info->title, sizeof(info->title), song.title);
    CopyText(info->album, sizeof(info->album), song.album);
    CopyText(info->artist, sizeof(info->artist), song.artist);
    CopyText(info->genre, sizeof(info->genre), song.genre);
    info->duration = (float)song.duration;
    info->bitrate = (uint32_t)song.bitrate;
    info->sample = song.sampleRate;
    info->channels = song.channels;
    info->size = song.size;
}

// ---------------------------------------------------------------------------
// Tag reading

// TagLib drops text fields that are not valid UTF-8 without telling, so the
// raw tag blocks of the two common UTF-8 tag kinds are checked here: the
// Vorbis comment of FLAC files and the UTF-8 text frames of ID3v2 tags.
// Returns the names of the fields whose bytes are not valid UTF-8.
static std::vector<std::string> CheckVorbisComment(const std::string &block)
{
    std::vector<std::string> bad;
    size_t p = 0;
    auto u32 = [&](uint32_t *v) {
        if (p + 4 > block.size())
            return false;
        const unsigned char *b = (const unsigned char *)block.data() + p;
        *v = b[0] | (b[1] << 8) | (b[2] << 16) | ((uint32_t)b[3] << 24);
        p += 4;
        return true;
    };
    uint32_t len, count;
    if (!u32(&len) || len > block.size() - p)
        return bad;
    p += len;  // vendor
    if (!u32(&count))
        return bad;
    for (uint32_t i = 0; i < count && i < 10000; i++) {
        if (!u32(&len) || len > block.size() - p)
            break;
        std::string field = block.substr(p, len);
        p += len;
        size_t eq = field.find('=');
        if (eq == std::string::npos)
            continue;
        if (!ValidUtf8(field.substr(eq + 1)))
            bad.push_back(field.substr(0, eq));
    }
    return bad;
}

static std::vector<std::string> CheckFlacRaw(FILE *f)
{
    unsigned char head[4];
    if (fread(head, 1, 4, f) != 4 || memcmp(head, "fLaC", 4) != 0)
        return {};
    for (int blocks = 0; blocks < 128; blocks++) {
        if (fread(head, 1, 4, f) != 4)
            break;
        bool last = head[0] & 0x80;
        int type = head[0] & 0x7F;
        uint32_t len = (head[1] << 16) | (head[2] << 8) | head[3];
        if (type == 4) {
            std::string block(len, '\0');
            if (fread(&block[0], 1, len, f) != len)
                return {};
            return CheckVorbisComment(block);
        }
        if (last || fseek(f, len, SEEK_CUR) != 0)
            break;
    }
    return {};
}

static std::vector<std::string> CheckId3v2Raw(FILE *f)
{
    std::vector<std::string> bad;
    unsigned char h[10];
    if (fread(h, 1, 10, f) != 10 || memcmp(h, "ID3", 3) != 0)
        return bad;
    int version = h[3];
    if (version < 3 || version > 4 || (h[5] & 0x80))  // unsynchronised tags are left to TagLib
        return bad;
    uint32_t size = ((h[6] & 0x7F) << 21) | ((h[7] & 0x7F) << 14) | ((h[8] & 0x7F) << 7) | (h[9] & 0x7F);
    if (size > (16u << 20))
        return bad;
    std::string tag(size, '\0');
    if (fread(&tag[0], 1, size, f) != size)
        return bad;
    size_t p = 0;
    if (h[5] & 0x40) {  // extended header
        if (tag.size() < 4)
            return bad;
        const unsigned char *b = (const unsigned char *)tag.data();
        uint32_t ext = version == 4 ? (((b[0] & 0x7F) << 21) | ((b[1] & 0x7F) << 14) | ((b[2] & 0x7F) << 7) | (b[3] & 0x7F))
                                    : ((b[0] << 24) | (b[1] << 16) | (b[2] << 8) | b[3]) + 4;
        p = ext;
    }
    while (p + 10 <= tag.size()) {
        const unsigned char *b = (const unsigned char *)tag.data() + p;
        if (b[0] == 0)
            break;
        uint32_t len = version == 4 ? (((b[4] & 0x7F) << 21) | ((b[5] & 0x7F) << 14) | ((b[6] & 0x7F) << 7) | (b[7] & 0x7F))
                                    : ((uint32_t)b[4] << 24) | (b[5] << 16) | (b[6] << 8) | b[7];
        std::string id((const char *)b, 4);
        if (len > tag.size() - p - 10)
            break;
        // Plain text frames in UTF-8 (encoding 3), without compression or
        // encryption flags.
        if (id[0] == 'T' && id != "TXXX" && len > 1 && b[10] == 3 && (b[9] & 0x0F) == 0) {
            std::string text = tag.substr(p + 11, len - 1);
            if (!ValidUtf8(text))
                bad.push_back(id);
        }
        p += 10 + len;
    }
    return bad;
}

static std::vector<std::string> RawTagCheck(const std::string &path)
{
    FILE *f = fopen(path.c_str(), "rb");
    if (!f)
        return {};
    std::vector<std::string> bad;
    std::string ext = LowerExt(path);
    if (ext == "flac")
        bad = CheckFlacRaw(f);
    else
        bad = CheckId3v2Raw(f);
    fclose(f);
    return bad;
}

static std::string Clean(const TagLib::String &s)
{
    std::string out = s.to8Bit(true);
    // Control characters (newlines included) are replaced by blanks; the
    // replacement character left by a bad decode is dropped.
    std::string r;
    r.reserve(out.size());
    for (size_t i = 0; i < out.size(); i++) {
        unsigned char c = (unsigned char)out[i];
        if (c < 0x20 || c == 0x7F) {
            r += ' ';
        } else if (c == 0xEF && i + 2 < out.size() && (unsigned char)out[i + 1] == 0xBF &&
                   (unsigned char)out[i + 2] == 0xBD) {
            i += 2;
        } else {
            r += (char)c;
        }
    }
    while (!r.empty() && r.back() == ' ')
        r.pop_back();
    size_t b = r.find_first_not_of(' ');
    return b == std::string::npos ? std::string() : r.substr(b);
}

int MediaReadTags(const std::string &path, MediaSong *song, std::string *why, std::string *warning)
{
    struct stat st;
    if (stat(path.c_str(), &st) != 0) {
        *why = std::string("cannot read file: ") + strerror(errno);
        return -1;
    }
    if (!S_ISREG(st.st_mode)) {
        *why = "not a regular file";
        return -1;
    }
    if (access(path.c_str(), R_OK) != 0) {
        *why = std::string("cannot read file: ") + strerror(errno);
        return -1;
    }
    TagLib::FileRef ref(path.c_str(), true, TagLib::AudioProperties::Average);
    if (ref.isNull() || !ref.file() || !ref.file()->isValid()) {
        *why = "not a valid audio file (unknown format or corrupt header)";
        return -1;
    }
    TagLib::AudioProperties *ap = ref.audioProperties();
    if (!ap || ap->sampleRate() <= 0 || ap->channels() <= 0) {
        *why = "no audio stream found (corrupt file)";
        return -1;
    }
    *song = MediaSong();
    song->path = path;
    song->size = (uint64_t)st.st_size;
    song->mtime = (int64_t)st.st_mtime;
    song->duration = ap->lengthInMilliseconds() / 1000.0;
    song->bitrate = ap->bitrate();
    song->sampleRate = ap->sampleRate();
    song->channels = ap->channels();
    std::vector<std::string> bad = RawTagCheck(path);
    if (TagLib::Tag *tag = ref.tag()) {
        song->title = Clean(tag->title());
        song->album = Clean(tag->album());
        song->artist = Clean(tag->artist());
        song->genre = Clean(tag->genre());
        song->track = (int)tag->track();
        song->year = (int)tag->year();
        TagLib::PropertyMap props = ref.file()->properties();
        if (props.contains("DISCNUMBER") && !props["DISCNUMBER"].isEmpty())
            song->disc = atoi(props["DISCNUMBER"].front().toCString());
    }
    if (!bad.empty()) {
        std::string names;
        for (const std::string &b : bad)
            names += (names.empty() ? "" : ", ") + b;
        *warning = "tag text is not valid UTF-8, dropped: " + names;
    } else {
        warning->clear();
    }
    if (song->title.empty()) {
        std::string name = fs::path(path).stem().string();
        song->title = ValidUtf8(name) ? name : std::string("(untitled)");
    }
    return 0;
}

// ---------------------------------------------------------------------------
// M3U files

static std::string UrlDecode(const std::string &s)
{
    std::string out;
    for (size_t i = 0; i < s.size(); i++) {
        if (s[i] == '%' && i + 2 < s.size() && isxdigit((unsigned char)s[i + 1]) &&
            isxdigit((unsigned char)s[i + 2])) {
            out += (char)strtol(s.substr(i + 1, 2).c_str(), nullptr, 16);
            i += 2;
        } else {
            out += s[i];
        }
    }
    return out;
}

static std::string Trim(const std::string &s)
{
    size_t b = s.find_first_not_of(" \t\r\n");
    if (b == std::string::npos)
        return std::string();
    size_t e = s.find_last_not_of(" \t\r\n");
    return s.substr(b, e - b + 1);
}

int M3uRead(const std::string &path, std::string *title, std::vector<M3uEntry> *entries)
{
    std::ifstream in(path, std::ios::binary);
    if (!in)
        return -1;
    entries->clear();
    *title = fs::path(path).stem().string();
    std::string dir = fs::path(path).parent_path().string();
    std::string line, extTitle;
    bool first = true;
    int lines = 0;
    while (std::getline(in, line) && lines++ < 1000000) {
        if (first && line.compare(0, 3, "\xEF\xBB\xBF") == 0)
            line.erase(0, 3);
        first = false;
        line = Trim(line);
        if (line.empty())
            continue;
        if (line[0] == '#') {
            if (line.compare(0, 10, "#PLAYLIST:") == 0) {
                std::string t = Trim(line.substr(10));
                if (!t.empty() && ValidUtf8(t))
                    *title = t;
            } else if (line.compare(0, 8, "#EXTINF:") == 0) {
                size_t comma = line.find(',');
                extTitle = comma == std::string::npos ? std::string() : Trim(line.substr(comma + 1));
                if (!ValidUtf8(extTitle))
                    extTitle.clear();
            }
            continue;
        }
        std::string p = line;
        if (p.compare(0, 7, "file://") == 0)
            p = UrlDecode(p.substr(7));
        else if (p.find("://") != std::string::npos) {
            extTitle.clear();
            continue;  // streams are not songs of the library
        }
        std::replace(p.begin(), p.end(), '\\', '/');
        fs::path fp(p);
        if (fp.is_relative())
            fp = fs::path(dir) / fp;
        M3uEntry e;
        e.path = fp.lexically_normal().string();
        e.title = extTitle;
        extTitle.clear();
        entries->push_back(e);
    }
    return 0;
}

// ---------------------------------------------------------------------------
// Smart rules

struct FieldDef {
    const char *name;
    const char *column;
    bool numeric;
};
static const FieldDef kFields[] = {
    {"title", "title", false},     {"album", "album", false},     {"artist", "artist", false},
    {"genre", "genre", false},     {"path", "path", false},       {"year", "year", true},
    {"track", "track", true},      {"disc", "disc", true},        {"duration", "duration", true},
    {"bitrate", "bitrate", true},
};

static const FieldDef *FindField(const std::string &name)
{
    for (const FieldDef &f : kFields)
        if (name == f.name)
            return &f;
    return nullptr;
}

static bool IsNumber(const std::string &s)
{
    if (s.empty())
        return false;
    char *end = nullptr;
    errno = 0;
    strtod(s.c_str(), &end);
    return errno == 0 && end && *end == '\0';
}

static int CheckRule(const SmartRule &r, std::string *why)
{
    const FieldDef *f = FindField(r.field);
    if (!f) {
        *why = "unknown field \"" + r.field +
               "\" (use title, album, artist, genre, path, year, track, disc, duration, bitrate)";
        return -1;
    }
    static const char *const kOps[] = {"is", "isnot", "contains", "startswith", "from", "above", "below"};
    bool known = false;
    for (const char *o : kOps)
        known = known || r.op == o;
    if (!known) {
        *why = "unknown operator \"" + r.op + "\" (use is, isnot, contains, startswith, from A to B, above, below)";
        return -1;
    }
    if ((r.op == "from" || r.op == "above" || r.op == "below") && !f->numeric) {
        *why = "operator \"" + r.op + "\" needs a numeric field";
        return -1;
    }
    if (f->numeric && (r.op == "is" || r.op == "isnot" || r.op == "from" || r.op == "above" || r.op == "below") &&
        !IsNumber(r.value)) {
        *why = "\"" + r.value + "\" is not a number";
        return -1;
    }
    if (r.op == "from" && !IsNumber(r.value2)) {
        *why = "\"from\" needs two numbers: from A to B";
        return -1;
    }
    if (r.value.empty()) {
        *why = "missing value";
        return -1;
    }
    if (!ValidUtf8(r.value) || !ValidUtf8(r.value2)) {
        *why = "value is not valid UTF-8";
        return -1;
    }
    return 0;
}

int SmartRuleParse(const std::string &text, SmartRule *rule, std::string *why)
{
    std::string t = Trim(text);
    size_t s1 = t.find(' ');
    if (s1 == std::string::npos) {
        *why = "a rule is FIELD OPERATOR VALUE, e.g. \"genre is Jazz\"";
        return -1;
    }
    SmartRule r;
    r.field = t.substr(0, s1);
    std::string rest = Trim(t.substr(s1));
    // Two-word operators.
    static const struct {
        const char *text, *op;
    } kMulti[] = {{"is not ", "isnot"}, {"starts with ", "startswith"}};
    bool done = false;
    for (const auto &m : kMulti) {
        if (rest.compare(0, strlen(m.text), m.text) == 0) {
            r.op = m.op;
            r.value = Trim(rest.substr(strlen(m.text)));
            done = true;
            break;
        }
    }
    if (!done) {
        size_t s2 = rest.find(' ');
        r.op = rest.substr(0, s2);
        r.value = s2 == std::string::npos ? std::string() : Trim(rest.substr(s2));
    }
    for (char &c : r.field)
        c = (char)tolower((unsigned char)c);
    for (char &c : r.op)
        c = (char)tolower((unsigned char)c);
    if (r.op == "from") {
        size_t to = r.value.find(" to ");
        if (to == std::string::npos) {
            *why = "\"from\" needs two numbers: from A to B";
            return -1;
        }
        r.value2 = Trim(r.value.substr(to + 4));
        r.value = Trim(r.value.substr(0, to));
    }
    if (CheckRule(r, why) != 0)
        return -1;
    *rule = r;
    return 0;
}

std::string SmartRuleText(const SmartRule &r)
{
    if (r.op == "from")
        return r.field + " from " + r.value + " to " + r.value2;
    if (r.op == "isnot")
        return r.field + " is not " + r.value;
    if (r.op == "startswith")
        return r.field + " starts with " + r.value;
    return r.field + " " + r.op + " " + r.value;
}

// ---------------------------------------------------------------------------
// Database

namespace {
// A prepared statement that is finalised when it goes out of scope.
class Stmt {
public:
    Stmt(sqlite3 *db, const char *sql) { rc_ = sqlite3_prepare_v2(db, sql, -1, &st_, nullptr); }
    ~Stmt() { sqlite3_finalize(st_); }
    bool ok() const { return rc_ == SQLITE_OK && st_; }
    sqlite3_stmt *get() { return st_; }
    void Text(int i, const std::string &s) { sqlite3_bind_text(st_, i, s.data(), (int)s.size(), SQLITE_TRANSIENT); }
    void Int(int i, int64_t v) { sqlite3_bind_int64(st_, i, v); }
    void Real(int i, double v) { sqlite3_bind_double(st_, i, v); }
    int Step() { return sqlite3_step(st_); }
    void Reset() { sqlite3_reset(st_); sqlite3_clear_bindings(st_); }
    std::string Col(int i)
    {
        const unsigned char *t = sqlite3_column_text(st_, i);
        return t ? std::string((const char *)t, sqlite3_column_bytes(st_, i)) : std::string();
    }
    int64_t ColInt(int i) { return sqlite3_column_int64(st_, i); }
    double ColReal(int i) { return sqlite3_column_double(st_, i); }

private:
    sqlite3_stmt *st_ = nullptr;
    int rc_;
};

const char kSongColumns[] =
    "id, path, title, album, artist, genre, track, disc, year, duration, bitrate, samplerate, "
    "channels, size, mtime";
const char kSongOrder[] =
    " ORDER BY artist COLLATE NOCASE, album COLLATE NOCASE, disc, track, path";

void ReadSong(Stmt &s, MediaSong *song)
{
    song->id = (uint32_t)s.ColInt(0);
    song->path = s.Col(1);
    song->title = s.Col(2);
    song->album = s.Col(3);
    song->artist = s.Col(4);
    song->genre = s.Col(5);
    song->track = (int)s.ColInt(6);
    song->disc = (int)s.ColInt(7);
    song->year = (int)s.ColInt(8);
    song->duration = s.ColReal(9);
    song->bitrate = (int)s.ColInt(10);
    song->sampleRate = (int)s.ColInt(11);
    song->channels = (int)s.ColInt(12);
    song->size = (uint64_t)s.ColInt(13);
    song->mtime = s.ColInt(14);
}
}  // namespace

MediaLib::MediaLib() {}
MediaLib::~MediaLib() { Close(); }

void MediaLib::Close()
{
    if (db_)
        sqlite3_close_v2(db_);
    db_ = nullptr;
}

int MediaLib::Fail(const char *what)
{
    int code = db_ ? sqlite3_errcode(db_) : SQLITE_ERROR;
    std::string msg = db_ ? sqlite3_errmsg(db_) : "no database";
    error_ = std::string(what) + ": " + msg;
    if (code == SQLITE_NOTADB || code == SQLITE_CORRUPT)
        error_ += " - the library database " + path_ +
                  " is damaged; move it aside and run \"tarnlib scan DIR\" to rebuild it";
    else if (code == SQLITE_BUSY || code == SQLITE_LOCKED)
        error_ += " - another process holds the library database " + path_ + "; try again later";
    else if (code == SQLITE_READONLY || code == SQLITE_CANTOPEN || code == SQLITE_PERM)
        error_ += " - check the permissions of " + path_ + " and its folder";
    TLOG("%s", error_.c_str());
    return -1;
}

int MediaLib::Exec(const char *sql)
{
    char *msg = nullptr;
    int rc = sqlite3_exec(db_, sql, nullptr, nullptr, &msg);
    sqlite3_free(msg);
    return rc == SQLITE_OK ? 0 : -1;
}

int MediaLib::Open(const std::string &path, bool create, bool readOnly)
{
    if (readOnly)
        create = false;
    Close();
    path_ = path;
    error_.clear();
    if (!create && access(path.c_str(), F_OK) != 0) {
        error_ = "no media library at " + path + " (run \"tarnlib scan DIR\" to create it)";
        TLOG("%s", error_.c_str());
        return -1;
    }
    if (create) {
        std::error_code ec;
        fs::create_directories(fs::path(path).parent_path(), ec);
    }
    int flags = (readOnly ? SQLITE_OPEN_READONLY : SQLITE_OPEN_READWRITE) | SQLITE_OPEN_NOMUTEX |
                (create ? SQLITE_OPEN_CREATE : 0);
    if (sqlite3_open_v2(path.c_str(), &db_, flags, nullptr) != SQLITE_OK)
        return Fail("cannot open the media library"), Close(), -1;
    sqlite3_busy_timeout(db_, 5000);
    sqlite3_extended_result_codes(db_, 0);
    if (readOnly) {
        Stmt v(db_, "PRAGMA application_id");
        if (!v.ok() || v.Step() != SQLITE_ROW)
            return Fail("cannot read the media library"), Close(), -1;
        if (v.ColInt(0) != kApplicationId) {
            error_ = path_ + " is not a media library (run \"tarnlib scan DIR\" to create one)";
            TLOG("%s", error_.c_str());
            Close();
            return -1;
        }
        return 0;
    }
    if (Exec("PRAGMA journal_mode=WAL") != 0 || Exec("PRAGMA foreign_keys=ON") != 0 ||
        Exec("PRAGMA synchronous=NORMAL") != 0) {
        Fail("cannot open the media library");
        Close();
        return -1;
    }
    if (SetupSchema() != 0) {
        Close();
        return -1;
    }
    return 0;
}

int MediaLib::SetupSchema()
{
    Stmt q(db_, "PRAGMA application_id");
    if (!q.ok() || q.Step() != SQLITE_ROW)
        return Fail("cannot read the media library");
    int64_t appId = q.ColInt(0);
    Stmt t(db_, "SELECT count(*) FROM sqlite_master");
    if (!t.ok() || t.Step() != SQLITE_ROW)
        return Fail("cannot read the media library");
    int64_t objects = t.ColInt(0);
    if (objects > 0 && appId != kApplicationId) {
        error_ = path_ + " is an SQLite database but not a media library; move it aside or choose another file";
        TLOG("%s", error_.c_str());
        return -1;
    }
    if (objects > 0) {
        Stmt v(db_, "PRAGMA user_version");
        if (!v.ok() || v.Step() != SQLITE_ROW)
            return Fail("cannot read the media library");
        if (v.ColInt(0) > kSchemaVersion) {
            error_ = path_ + " was written by a newer version of the media library";
            TLOG("%s", error_.c_str());
            return -1;
        }
        return 0;
    }
    static const char kSchema[] =
        "BEGIN IMMEDIATE;"
        "CREATE TABLE IF NOT EXISTS songs(id INTEGER PRIMARY KEY AUTOINCREMENT, path TEXT NOT NULL UNIQUE,"
        " title TEXT NOT NULL DEFAULT '', album TEXT NOT NULL DEFAULT '', artist TEXT NOT NULL DEFAULT '',"
        " genre TEXT NOT NULL DEFAULT '', track INTEGER NOT NULL DEFAULT 0, disc INTEGER NOT NULL DEFAULT 0,"
        " year INTEGER NOT NULL DEFAULT 0, duration REAL NOT NULL DEFAULT 0, bitrate INTEGER NOT NULL DEFAULT 0,"
        " samplerate INTEGER NOT NULL DEFAULT 0, channels INTEGER NOT NULL DEFAULT 0,"
        " size INTEGER NOT NULL DEFAULT 0, mtime INTEGER NOT NULL DEFAULT 0);"
        "CREATE TABLE IF NOT EXISTS playlists(path TEXT PRIMARY KEY, title TEXT NOT NULL,"
        " size INTEGER NOT NULL DEFAULT 0, mtime INTEGER NOT NULL DEFAULT 0);"
        "CREATE TABLE IF NOT EXISTS smart(id INTEGER PRIMARY KEY AUTOINCREMENT, name TEXT NOT NULL UNIQUE,"
        " match_any INTEGER NOT NULL DEFAULT 0);"
        "CREATE TABLE IF NOT EXISTS smart_rules(smart_id INTEGER NOT NULL REFERENCES smart(id) ON DELETE CASCADE,"
        " seq INTEGER NOT NULL, field TEXT NOT NULL, op TEXT NOT NULL, value TEXT NOT NULL,"
        " value2 TEXT NOT NULL DEFAULT '');"
        "CREATE INDEX IF NOT EXISTS songs_artist ON songs(artist COLLATE NOCASE, album COLLATE NOCASE);"
        "PRAGMA application_id=1413567054;"
        "PRAGMA user_version=1;"
        "COMMIT;";
    static_assert(kApplicationId == 1413567054, "application id");
    if (Exec(kSchema) != 0) {
        Fail("cannot create the media library");
        Exec("ROLLBACK");
        return -1;
    }
    return 0;
}

int MediaLib::Scan(const std::string &dirIn, ScanReport *report,
                   const std::function<void(int, int)> &progress, uint64_t maxFileSize)
{
    *report = ScanReport();
    if (!db_) {
        error_ = "the media library is not open";
        return -1;
    }
    std::error_code ec;
    fs::path root = fs::canonical(dirIn, ec);
    if (ec || !fs::is_directory(root, ec)) {
        error_ = "cannot scan " + dirIn + ": not a readable folder";
        TLOG("%s", error_.c_str());
        return -1;
    }
    std::string dir = root.string();
    std::string lo = dir == "/" ? "/" : dir + "/";
    std::string hi = dir == "/" ? "0" : dir + "0";  // '0' follows '/'

    // 1. What is on disk.
    struct OnDisk {
        uint64_t size;
        int64_t mtime;
    };
    std::map<std::string, OnDisk> audio, lists;
    fs::recursive_directory_iterator it(root, fs::directory_options::skip_permission_denied, ec), end;
    if (ec) {
        error_ = "cannot scan " + dir + ": " + ec.message();
        return -1;
    }
    for (; it != end; it.increment(ec)) {
        if (ec) {
            report->failed++;
            report->failures.push_back(it->path().string() + ": " + ec.message());
            ec.clear();
            continue;
        }
        const fs::directory_entry &de = *it;
        std::string p = de.path().string();
        bool isAudio = MediaLibIsAudioFile(p), isList = MediaLibIsPlaylistFile(p);
        if (!isAudio && !isList)
            continue;
        struct stat st;
        if (stat(p.c_str(), &st) != 0 || !S_ISREG(st.st_mode))
            continue;
        if (!ValidUtf8(p)) {
            report->failed++;
            report->failures.push_back(p + ": file name is not valid UTF-8");
            continue;
        }
        (isAudio ? audio : lists)[p] = OnDisk{(uint64_t)st.st_size, (int64_t)st.st_mtime};
    }
    report->seen = (int)audio.size();

    // 2. What the library holds below dir.
    std::map<std::string, OnDisk> known, knownLists;
    {
        Stmt s(db_, "SELECT path, size, mtime FROM songs WHERE path >= ? AND path < ?");
        if (!s.ok())
            return Fail("cannot read the media library");
        s.Text(1, lo);
        s.Text(2, hi);
        int rc;
        while ((rc = s.Step()) == SQLITE_ROW)
            known[s.Col(0)] = OnDisk{(uint64_t)s.ColInt(1), s.ColInt(2)};
        if (rc != SQLITE_DONE)
            return Fail("cannot read the media library");
        Stmt l(db_, "SELECT path, size, mtime FROM playlists WHERE path >= ? AND path < ?");
        if (!l.ok())
            return Fail("cannot read the media library");
        l.Text(1, lo);
        l.Text(2, hi);
        while ((rc = l.Step()) == SQLITE_ROW)
            knownLists[l.Col(0)] = OnDisk{(uint64_t)l.ColInt(1), l.ColInt(2)};
        if (rc != SQLITE_DONE)
            return Fail("cannot read the media library");
    }

    // 3. Read the tags of new and changed files (outside the transaction, so
    // that readers are not held up by the slow part).
    std::vector<std::string> toRead;
    for (const auto &kv : audio) {
        auto k = known.find(kv.first);
        if (k == known.end() || k->second.size != kv.second.size || k->second.mtime != kv.second.mtime)
            toRead.push_back(kv.first);
    }
    std::vector<MediaSong> songs;
    std::vector<std::string> failedKnown;  // known files that became unreadable
    int total = (int)toRead.size();
    for (int i = 0; i < total; i++) {
        const std::string &p = toRead[i];
        MediaSong song;
        std::string why, warning;
        if (audio[p].size > maxFileSize) {
            why = "file too large (" + std::to_string(audio[p].size) + " bytes, limit " +
                  std::to_string(maxFileSize) + ")";
        } else if (MediaReadTags(p, &song, &why, &warning) == 0) {
            songs.push_back(song);
            if (!warning.empty())
                report->warnings.push_back(p + ": " + warning);
        }
        if (!why.empty()) {
            report->failed++;
            report->failures.push_back(p + ": " + why);
            if (known.count(p))
                failedKnown.push_back(p);
        }
        if (progress)
            progress(i + 1, total);
    }

    // 4. Write everything in one transaction.
    if (Exec("BEGIN IMMEDIATE") != 0)
        return Fail("cannot start the library update");
    auto rollback = [&](const char *what) {
        Fail(what);
        Exec("ROLLBACK");
        return -1;
    };
    {
        Stmt ins(db_,
                 "INSERT INTO songs(path, title, album, artist, genre, track, disc, year, duration, bitrate,"
                 " samplerate, channels, size, mtime) VALUES(?,?,?,?,?,?,?,?,?,?,?,?,?,?)"
                 " ON CONFLICT(path) DO UPDATE SET title=excluded.title, album=excluded.album,"
                 " artist=excluded.artist, genre=excluded.genre, track=excluded.track, disc=excluded.disc,"
                 " year=excluded.year, duration=excluded.duration, bitrate=excluded.bitrate,"
                 " samplerate=excluded.samplerate, channels=excluded.channels, size=excluded.size,"
                 " mtime=excluded.mtime");
        if (!ins.ok())
            return rollback("cannot update the media library");
        for (const MediaSong &s : songs) {
            ins.Text(1, s.path);
            ins.Text(2, s.title);
            ins.Text(3, s.album);
            ins.Text(4, s.artist);
            ins.Text(5, s.genre);
            ins.Int(6, s.track);
            ins.Int(7, s.disc);
            ins.Int(8, s.year);
            ins.Real(9, s.duration);
            ins.Int(10, s.bitrate);
            ins.Int(11, s.sampleRate);
            ins.Int(12, s.channels);
            ins.Int(13, (int64_t)s.size);
            ins.Int(14, s.mtime);
            if (ins.Step() != SQLITE_DONE)
                return rollback("cannot update the media library");
            ins.Reset();
            if (known.count(s.path))
                report->updated++;
            else
                report->added++;
        }
        Stmt del(db_, "DELETE FROM songs WHERE path = ?");
        if (!del.ok())
            return rollback("cannot update the media library");
        for (const auto &kv : known) {
            bool gone = !audio.count(kv.first);
            bool broken = std::find(failedKnown.begin(), failedKnown.end(), kv.first) != failedKnown.end();
            if (!gone && !broken)
                continue;
            del.Text(1, kv.first);
            if (del.Step() != SQLITE_DONE)
                return rollback("cannot update the media library");
            del.Reset();
            if (gone)
                report->removed++;
        }
        report->unchanged = (int)(audio.size() - toRead.size());
        // Saved playlists.
        Stmt pins(db_,
                  "INSERT INTO playlists(path, title, size, mtime) VALUES(?,?,?,?)"
                  " ON CONFLICT(path) DO UPDATE SET title=excluded.title, size=excluded.size, mtime=excluded.mtime");
        Stmt pdel(db_, "DELETE FROM playlists WHERE path = ?");
        if (!pins.ok() || !pdel.ok())
            return rollback("cannot update the media library");
        for (const auto &kv : lists) {
            auto k = knownLists.find(kv.first);
            if (k != knownLists.end() && k->second.size == kv.second.size && k->second.mtime == kv.second.mtime)
                continue;
            std::string title;
            std::vector<M3uEntry> entries;
            if (M3uRead(kv.first, &title, &entries) != 0) {
                report->failed++;
                report->failures.push_back(kv.first + ": cannot read playlist");
                continue;
            }
            pins.Text(1, kv.first);
            pins.Text(2, title);
            pins.Int(3, (int64_t)kv.second.size);
            pins.Int(4, kv.second.mtime);
            if (pins.Step() != SQLITE_DONE)
                return rollback("cannot update the media library");
            pins.Reset();
        }
        for (const auto &kv : knownLists) {
            if (lists.count(kv.first))
                continue;
            pdel.Text(1, kv.first);
            if (pdel.Step() != SQLITE_DONE)
                return rollback("cannot update the media library");
            pdel.Reset();
        }
    }
    if (Exec("COMMIT") != 0)
        return rollback("cannot save the library update");
    Stmt c(db_, "SELECT count(*) FROM playlists");
    if (c.ok() && c.Step() == SQLITE_ROW)
        report->playlists = (int)c.ColInt(0);
    return 0;
}

int MediaLib::SongCount()
{
    if (!db_)
        return -1;
    Stmt s(db_, "SELECT count(*) FROM songs");
    if (!s.ok() || s.Step() != SQLITE_ROW)
        return Fail("cannot read the media library");
    return (int)s.ColInt(0);
}

int MediaLib::FindById(uint32_t id, MediaSong *song)
{
    if (!db_)
        return -1;
    std::string sql = std::string("SELECT ") + kSongColumns + " FROM songs WHERE id = ?";
    Stmt s(db_, sql.c_str());
    if (!s.ok())
        return Fail("cannot read the media library");
    s.Int(1, id);
    int rc = s.Step();
    if (rc == SQLITE_ROW) {
        ReadSong(s, song);
        return 1;
    }
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}

int MediaLib::FindByPath(const std::string &path, MediaSong *song)
{
    if (!db_)
        return -1;
    std::string sql = std::string("SELECT ") + kSongColumns + " FROM songs WHERE path = ?";
    Stmt s(db_, sql.c_str());
    if (!s.ok())
        return Fail("cannot read the media library");
    s.Text(1, path);
    int rc = s.Step();
    if (rc == SQLITE_ROW) {
        ReadSong(s, song);
        return 1;
    }
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}

int MediaLib::ListSongs(std::vector<MediaSong> *songs, int start, int limit)
{
    songs->clear();
    if (!db_)
        return -1;
    std::string sql = std::string("SELECT ") + kSongColumns + " FROM songs" + kSongOrder + " LIMIT ? OFFSET ?";
    Stmt s(db_, sql.c_str());
    if (!s.ok())
        return Fail("cannot read the media library");
    s.Int(1, limit > 0 ? limit : -1);
    s.Int(2, start > 0 ? start : 0);
    int rc;
    while ((rc = s.Step()) == SQLITE_ROW) {
        songs->emplace_back();
        ReadSong(s, &songs->back());
    }
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}

int MediaLib::RandomSongs(int count, std::vector<MediaSong> *songs)
{
    songs->clear();
    if (!db_)
        return -1;
    // Shuffles the ids only, then reads the chosen rows.
    std::string sql = std::string("SELECT ") + kSongColumns +
                      " FROM songs WHERE id IN (SELECT id FROM songs ORDER BY random() LIMIT ?) ORDER BY random()";
    Stmt s(db_, sql.c_str());
    if (!s.ok())
        return Fail("cannot read the media library");
    s.Int(1, count);
    int rc;
    while ((rc = s.Step()) == SQLITE_ROW) {
        songs->emplace_back();
        ReadSong(s, &songs->back());
    }
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}

int MediaLib::ListPlaylists(std::vector<MediaPlaylist> *lists)
{
    lists->clear();
    if (!db_)
        return -1;
    Stmt s(db_, "SELECT path, title FROM playlists ORDER BY title COLLATE NOCASE, path");
    if (!s.ok())
        return Fail("cannot read the media library");
    int rc;
    while ((rc = s.Step()) == SQLITE_ROW)
        lists->push_back(MediaPlaylist{s.Col(0), s.Col(1)});
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}

int MediaLib::FindPlaylist(const std::string &path, MediaPlaylist *list)
{
    if (!db_)
        return -1;
    Stmt s(db_, "SELECT path, title FROM playlists WHERE path = ?");
    if (!s.ok())
        return Fail("cannot read the media library");
    s.Text(1, path);
    int rc = s.Step();
    if (rc == SQLITE_ROW) {
        *list = MediaPlaylist{s.Col(0), s.Col(1)};
        return 1;
    }
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}

int MediaLib::ListSmart(std::vector<SmartPlaylist> *lists)
{
    lists->clear();
    if (!db_)
        return -1;
    Stmt s(db_, "SELECT id, name, match_any FROM smart ORDER BY id");
    Stmt r(db_, "SELECT field, op, value, value2 FROM smart_rules WHERE smart_id = ? ORDER BY seq");
    if (!s.ok() || !r.ok())
        return Fail("cannot read the media library");
    int rc;
    while ((rc = s.Step()) == SQLITE_ROW) {
        SmartPlaylist p;
        p.id = s.ColInt(0);
        p.name = s.Col(1);
        p.matchAny = s.ColInt(2) != 0;
        r.Int(1, p.id);
        int rr;
        while ((rr = r.Step()) == SQLITE_ROW)
            p.rules.push_back(SmartRule{r.Col(0), r.Col(1), r.Col(2), r.Col(3)});
        r.Reset();
        if (rr != SQLITE_DONE)
            return Fail("cannot read the media library");
        lists->push_back(p);
    }
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}

int MediaLib::FindSmart(const std::string &name, SmartPlaylist *list)
{
    std::vector<SmartPlaylist> all;
    if (ListSmart(&all) != 0)
        return -1;
    for (const SmartPlaylist &p : all) {
        if (p.name == name) {
            *list = p;
            return 1;
        }
    }
    return 0;
}

int MediaLib::SaveSmart(const SmartPlaylist &list)
{
    if (!db_)
        return -1;
    if (list.name.empty() || !ValidUtf8(list.name)) {
        error_ = "a smart playlist needs a name in UTF-8";
        return -1;
    }
    if (list.rules.empty()) {
        error_ = "a smart playlist needs at least one rule";
        return -1;
    }
    for (const SmartRule &r : list.rules) {
        std::string why;
        if (CheckRule(r, &why) != 0) {
            error_ = "rule \"" + SmartRuleText(r) + "\": " + why;
            return -1;
        }
    }
    if (Exec("BEGIN IMMEDIATE") != 0)
        return Fail("cannot update the media library");
    auto rollback = [&]() {
        Fail("cannot save the smart playlist");
        Exec("ROLLBACK");
        return -1;
    };
    // An existing playlist keeps its place (id) in the library's order.
    Stmt up(db_, "INSERT INTO smart(name, match_any) VALUES(?, ?)"
                 " ON CONFLICT(name) DO UPDATE SET match_any = excluded.match_any");
    if (!up.ok())
        return rollback();
    up.Text(1, list.name);
    up.Int(2, list.matchAny ? 1 : 0);
    if (up.Step() != SQLITE_DONE)
        return rollback();
    Stmt id(db_, "SELECT id FROM smart WHERE name = ?");
    if (!id.ok())
        return rollback();
    id.Text(1, list.name);
    if (id.Step() != SQLITE_ROW)
        return rollback();
    int64_t sid = id.ColInt(0);
    Stmt del(db_, "DELETE FROM smart_rules WHERE smart_id = ?");
    if (!del.ok())
        return rollback();
    del.Int(1, sid);
    if (del.Step() != SQLITE_DONE)
        return rollback();
    Stmt ins(db_, "INSERT INTO smart_rules(smart_id, seq, field, op, value, value2) VALUES(?,?,?,?,?,?)");
    if (!ins.ok())
        return rollback();
    int seq = 0;
    for (const SmartRule &r : list.rules) {
        ins.Int(1, sid);
        ins.Int(2, seq++);
        ins.Text(3, r.field);
        ins.Text(4, r.op);
        ins.Text(5, r.value);
        ins.Text(6, r.value2);
        if (ins.Step() != SQLITE_DONE)
            return rollback();
        ins.Reset();
    }
    if (Exec("COMMIT") != 0)
        return rollback();
    return 0;
}

int MediaLib::DeleteSmart(const std::string &name)
{
    if (!db_)
        return -1;
    Stmt s(db_, "DELETE FROM smart WHERE name = ?");
    if (!s.ok())
        return Fail("cannot update the media library");
    s.Text(1, name);
    if (s.Step() != SQLITE_DONE)
        return Fail("cannot update the media library");
    return sqlite3_changes(db_) > 0 ? 1 : 0;
}

int MediaLib::SmartSongs(const SmartPlaylist &list, std::vector<MediaSong> *songs, int start, int limit,
                         int *total)
{
    songs->clear();
    *total = 0;
    if (!db_)
        return -1;
    // The SQL text is made only of fixed fragments chosen from the field and
    // operator tables; every value is bound as a parameter.
    std::string where;
    struct Bind {
        bool numeric;
        std::string text;
    };
    std::vector<Bind> binds;
    for (const SmartRule &r : list.rules) {
        std::string why;
        if (CheckRule(r, &why) != 0) {
            error_ = "smart playlist \"" + list.name + "\": rule \"" + SmartRuleText(r) + "\": " + why;
            TLOG("%s", error_.c_str());
            return -1;
        }
        const FieldDef *f = FindField(r.field);
        std::string col = f->column;
        std::string cond;
        bool num = f->numeric;
        if (r.op == "is" || r.op == "isnot") {
            cond = col + (r.op == "is" ? " = ?" : " <> ?") + (num ? "" : " COLLATE NOCASE");
            binds.push_back({num, r.value});
        } else if (r.op == "contains" || r.op == "startswith") {
            std::string esc;
            for (char c : r.value) {
                if (c == '%' || c == '_' || c == '\\')
                    esc += '\\';
                esc += c;
            }
            cond = "CAST(" + col + " AS TEXT) LIKE ? ESCAPE '\\'";
            binds.push_back({false, (r.op == "contains" ? "%" : "") + esc + "%"});
        } else if (r.op == "from") {
            cond = col + " BETWEEN ? AND ?";
            binds.push_back({true, r.value});
            binds.push_back({true, r.value2});
        } else if (r.op == "above") {
            cond = col + " > ?";
            binds.push_back({true, r.value});
        } else {
            cond = col + " < ?";
            binds.push_back({true, r.value});
        }
        if (!where.empty())
            where += list.matchAny ? " OR " : " AND ";
        where += "(" + cond + ")";
    }
    if (where.empty())
        where = "1";
    auto bindAll = [&](Stmt &s) {
        int i = 1;
        for (const Bind &b : binds) {
            if (b.numeric)
                s.Real(i++, strtod(b.text.c_str(), nullptr));
            else
                s.Text(i++, b.text);
        }
        return i;
    };
    Stmt c(db_, ("SELECT count(*) FROM songs WHERE " + where).c_str());
    if (!c.ok())
        return Fail("cannot read the media library");
    bindAll(c);
    if (c.Step() != SQLITE_ROW)
        return Fail("cannot read the media library");
    *total = (int)c.ColInt(0);
    std::string sql = std::string("SELECT ") + kSongColumns + " FROM songs WHERE " + where + kSongOrder +
                      " LIMIT ? OFFSET ?";
    Stmt s(db_, sql.c_str());
    if (!s.ok())
        return Fail("cannot read the media library");
    int i = bindAll(s);
    s.Int(i, limit > 0 ? limit : -1);
    s.Int(i + 1, start > 0 ? start : 0);
    int rc;
    while ((rc = s.Step()) == SQLITE_ROW) {
        songs->emplace_back();
        ReadSong(s, &songs->back());
    }
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}
