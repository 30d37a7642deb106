// The media library database and its scanner.
//
// This file: the default location, file kinds, text helpers and the song
// record. Tags are read in medialib_tags.cpp, M3U files in medialib_m3u.cpp,
// smart rules and smart playlists in medialib_smart.cpp, the SQLite store in
// medialib_store.cpp and the scan in medialib_scan.cpp.
#include "platform/medialib.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>

#include "platform/medialib_internal.h"
#include "platform/tarn_env.h"

// ---------------------------------------------------------------------------
// Default location

static std::mutex g_pathLock;
static std::string g_defaultPath;

using namespace medialib_internal;

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

std::string medialib_internal::LowerExt(const std::string &path)
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

bool medialib_internal::ValidUtf8(const std::string &s)
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

