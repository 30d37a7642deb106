// The media library's tag reading (TagLib, with a check of the raw text
// fields that TagLib would drop silently).
#include "platform/medialib.h"

#include <sys/stat.h>
#include <unistd.h>

#include <taglib/audioproperties.h>
#include <taglib/fileref.h>
#include <taglib/tag.h>
#include <taglib/tpropertymap.h>

#include <cstdio>
#include <cstring>
#include <filesystem>

#include "platform/medialib_internal.h"
#include "platform/tarn_log.h"

namespace fs = std::filesystem;
using namespace medialib_internal;

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
