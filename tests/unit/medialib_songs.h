// Tagged songs for the media library tests and benchmark: one short tone per
// format encoded once (sox, lame, flac, oggenc) into a cache folder, copied
// and tagged with TagLib.
#ifndef TARN_TEST_MEDIALIB_SONGS_H
#define TARN_TEST_MEDIALIB_SONGS_H

#include <sys/stat.h>
#include <taglib/fileref.h>
#include <taglib/tag.h>
#include <taglib/tpropertymap.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>

namespace medialibtest {

struct Tags {
    std::string title, artist, album, genre;
    int year = 0, track = 0;
};

// The template of one format ("mp3", "flac", "ogg", "wav"); "" on failure.
inline std::string TemplateSong(const std::string &cacheDir, const std::string &ext)
{
    std::string out = cacheDir + "/template." + ext;
    struct stat st;
    if (stat(out.c_str(), &st) == 0)
        return out;
    std::filesystem::create_directories(cacheDir);
    std::string wav = cacheDir + "/template-src.wav";
    if (stat(wav.c_str(), &st) != 0) {
        std::string cmd = "sox -q -n -r 22050 -c 1 -b 16 '" + wav + "' synth 0.3 sine 440";
        if (system(cmd.c_str()) != 0)
            return "";
    }
    std::string in = "'" + wav + "' ", to = "'" + out + "'";
    std::string cmd = ext == "mp3"  ? "lame --quiet -b 32 --id3v2-only --tt x " + in + to
                      : ext == "flac" ? "flac -s -f " + in + "-o " + to
                      : ext == "ogg"  ? "oggenc -Q " + in + "-o " + to
                      : ext == "wav"  ? "cp " + in + to : "";
    if (cmd.empty())
        return "";
    if (system((cmd + " >/dev/null 2>&1").c_str()) != 0)
        return "";
    return out;
}

// Copies the template of path's extension to path and writes the tags.
inline bool MakeSong(const std::string &cacheDir, const std::string &path, const Tags &t)
{
    std::string ext = std::filesystem::path(path).extension().string().substr(1);
    std::string tmpl = TemplateSong(cacheDir, ext);
    if (tmpl.empty())
        return false;
    std::error_code ec;
    std::filesystem::create_directories(std::filesystem::path(path).parent_path(), ec);
    std::filesystem::copy_file(tmpl, path, std::filesystem::copy_options::overwrite_existing, ec);
    if (ec)
        return false;
    TagLib::FileRef f(path.c_str());
    if (f.isNull() || !f.tag())
        return false;
    f.tag()->setTitle(TagLib::String(t.title, TagLib::String::UTF8));
    f.tag()->setArtist(TagLib::String(t.artist, TagLib::String::UTF8));
    f.tag()->setAlbum(TagLib::String(t.album, TagLib::String::UTF8));
    f.tag()->setGenre(TagLib::String(t.genre, TagLib::String::UTF8));
    f.tag()->setYear(t.year);
    f.tag()->setTrack(t.track);
    return f.save();
}

}  // namespace medialibtest

#endif
