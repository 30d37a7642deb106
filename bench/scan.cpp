// Media library figures:
//  - scan rate (files per second) of a folder of generated tagged songs
//    (default 2,000: mp3, flac and ogg copies of tiny encoded tones, each
//    tagged with TagLib): a first scan into an empty library (median of 3)
//    and a rescan with nothing changed (median of 5);
//  - AudioFile::PlaylistRandomCreate(path, 100) and loading the file back
//    (AudioFile::PlaylistFileLoad) on a library of 20,000 songs (the 2,000
//    files hard-linked into 10 folders), median of 21 runs each.
//
//   bench_scan [--files N] [--songs N]
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "platform/media_playlists.h"
#include "platform/medialib.h"
#include "tests/unit/medialib_songs.h"

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

static double Seconds(Clock::time_point since)
{
    return std::chrono::duration<double>(Clock::now() - since).count();
}

static double Median(std::vector<double> v)
{
    std::sort(v.begin(), v.end());
    return v[v.size() / 2];
}

static int ScanOnce(const std::string &db, const std::string &dir, bool fresh, double *secs, ScanReport *r)
{
    if (fresh) {
        for (const char *suffix : {"", "-wal", "-shm"})
            unlink((db + suffix).c_str());
    }
    MediaLib lib;
    if (lib.Open(db, true) != 0) {
        fprintf(stderr, "bench_scan: %s\n", lib.LastError().c_str());
        return -1;
    }
    Clock::time_point t0 = Clock::now();
    if (lib.Scan(dir, r) != 0) {
        fprintf(stderr, "bench_scan: %s\n", lib.LastError().c_str());
        return -1;
    }
    *secs = Seconds(t0);
    return 0;
}

int main(int argc, char **argv)
{
    int files = 2000, songs = 20000;
    for (int i = 1; i + 1 < argc; i += 2) {
        if (strcmp(argv[i], "--files") == 0)
            files = atoi(argv[i + 1]);
        else if (strcmp(argv[i], "--songs") == 0)
            songs = atoi(argv[i + 1]);
    }
    if (files < 1 || songs < files) {
        fprintf(stderr, "usage: bench_scan [--files N] [--songs N >= files]\n");
        return 2;
    }
    char tmpl[] = "/tmp/bench-scan.XXXXXX";
    if (!mkdtemp(tmpl)) {
        perror("mkdtemp");
        return 1;
    }
    std::string work = tmpl, music = work + "/music", cache = work + "/cache", db = work + "/medialib.db";
    int status = 1;
    do {
        // Folder of tagged songs.
        static const char *const kExt[] = {"mp3", "flac", "ogg"};
        static const char *const kGenres[] = {"Jazz", "Rock", "Pop", "Classical", "Folk"};
        Clock::time_point t0 = Clock::now();
        bool ok = true;
        for (int i = 0; i < files && ok; i++) {
            medialibtest::Tags t;
            t.title = "Song " + std::to_string(i);
            t.artist = "Artist " + std::to_string(i % 97);
            t.album = "Album " + std::to_string(i % 211);
            t.genre = kGenres[i % 5];
            t.year = 1960 + i % 60;
            t.track = 1 + i % 12;
            std::string path = music + "/d" + std::to_string(i / 100) + "/s" + std::to_string(i) + "." + kExt[i % 3];
            ok = medialibtest::MakeSong(cache, path, t);
            if ((i + 1) % 500 == 0)
                fprintf(stderr, "generated %d/%d files\n", i + 1, files);
        }
        if (!ok) {
            fprintf(stderr, "bench_scan: cannot generate songs (sox, lame, flac and oggenc needed)\n");
            break;
        }
        printf("generated %d tagged files in %.2f s\n", files, Seconds(t0));

        // First scans into an empty library, then rescans with nothing changed.
        std::vector<double> first, again;
        ScanReport r;
        double secs = 0;
        bool failed = false;
        for (int run = 0; run < 3 && !failed; run++) {
            failed = ScanOnce(db, music, true, &secs, &r) != 0;
            if (!failed && r.added != files) {
                fprintf(stderr, "bench_scan: scan added %d of %d files (%d failed)\n", r.added, files, r.failed);
                failed = true;
            }
            first.push_back(files / secs);
        }
        for (int run = 0; run < 5 && !failed; run++) {
            failed = ScanOnce(db, music, false, &secs, &r) != 0;
            if (!failed && r.unchanged != files) {
                fprintf(stderr, "bench_scan: rescan found %d unchanged of %d\n", r.unchanged, files);
                failed = true;
            }
            again.push_back(files / secs);
        }
        if (failed)
            break;
        printf("scan of %d new files: median %.0f files/s (3 runs)\n", files, Median(first));
        printf("rescan of %d unchanged files: median %.0f files/s (5 runs)\n", files, Median(again));

        // A library of `songs` songs: the files hard-linked into more folders.
        std::string big = work + "/big";
        int copies = (songs + files - 1) / files;
        int made = 0;
        for (int c = 0; c < copies && made < songs; c++) {
            for (const auto &e : fs::recursive_directory_iterator(music)) {
                if (made >= songs)
                    break;
                if (!e.is_regular_file())
                    continue;
                fs::path dst = fs::path(big) / ("copy" + std::to_string(c)) / fs::relative(e.path(), music);
                fs::create_directories(dst.parent_path());
                std::error_code ec;
                fs::create_hard_link(e.path(), dst, ec);
                if (ec)
                    fs::copy_file(e.path(), dst, ec);
                made++;
            }
        }
        t0 = Clock::now();
        if (ScanOnce(db, big, true, &secs, &r) != 0)
            break;
        printf("scan of %d new files (hard links of the same songs): %.2f s, %.0f files/s\n", r.added, secs,
               r.added / secs);
        MediaLibSetDefaultPath(db);
        std::string list = work + "/==DynaRandom100==.@remote_control";
        std::vector<double> create, load;
        for (int run = 0; run < 21 && !failed; run++) {
            t0 = Clock::now();
            if (!AudioFile::PlaylistRandomCreate(list.c_str(), 100)) {
                fprintf(stderr, "bench_scan: PlaylistRandomCreate failed\n");
                failed = true;
                break;
            }
            create.push_back(Seconds(t0) * 1000);
            t0 = Clock::now();
            AudioFile::PlaylistFile *file = AudioFile::PlaylistFileLoad(list.c_str(), 0, 0);
            load.push_back(Seconds(t0) * 1000);
            if (!file || file->Count() != 100) {
                fprintf(stderr, "bench_scan: random playlist has %zu songs, not 100\n", file ? file->Count() : 0);
                failed = true;
            }
            delete file;
        }
        if (failed)
            break;
        printf("PlaylistRandomCreate(100) on %d songs: median %.2f ms (21 runs)\n", r.added, Median(create));
        printf("PlaylistFileLoad of the 100 songs: median %.2f ms (21 runs)\n", Median(load));
        status = 0;
    } while (false);
    std::error_code ec;
    fs::remove_all(work, ec);
    return status;
}
