// Song server and renderer tests: a library of demo songs, the song server.
#ifndef TARN_TARNWEB_TEST_UTIL_H
#define TARN_TARNWEB_TEST_UTIL_H

#include <signal.h>
#include <unistd.h>

#include <fstream>
#include <sstream>

#include "platform/medialib.h"
#include "tests/harness/harness.h"
#include "tests/tools/fakedevice/fake_device.h"

namespace tarnwebtest {

inline std::string ReadAll(const std::string &path)
{
    std::stringstream ss;
    ss << std::ifstream(path, std::ios::binary).rdbuf();
    return ss.str();
}

// The three demo songs (mp3, flac, ogg) of `seconds` under dir, scanned into
// a new library at its default place; in library order, empty on failure.
inline std::vector<MediaSong> MakeLibrary(tarntest::Harness &h, const char *dir, int seconds,
                                          std::string *error)
{
    std::vector<MediaSong> songs;
    MediaLib lib;
    ScanReport report;
    if (h.Run({"/bin/sh", tarntest::SourcePath("scripts/make-demo-songs.sh"), h.Path(dir),
               std::to_string(seconds)}, error, 120000) != 0)
        return songs;
    if (lib.Open(MediaLibDefaultPath(), true) != 0 || lib.Scan(h.Path(dir), &report) != 0 ||
        lib.ListSongs(&songs) < 0)
        *error = "library: " + lib.LastError();
    return songs;
}

// Ends a child of the test by its pid: SIGTERM, then SIGKILL. Exit status.
inline int EndChild(tarntest::Harness &h, pid_t &pid)
{
    int status = -1;
    if (pid > 0 && kill(pid, SIGTERM) == 0 && (status = h.WaitExit(pid, 10000)) == -1) {
        kill(pid, SIGKILL);
        h.WaitExit(pid, 5000);
    }
    pid = 0;
    return status;
}

// tarnweb with args, once it listens on port 18080; 0 when it did not.
inline pid_t StartSongServer(tarntest::Harness &h, std::vector<std::string> args)
{
    args.insert(args.begin(), tarntest::BinPath("tarnweb"));
    pid_t pid = h.Spawn(args, true);
    for (int waited = 0; pid > 0 && waited < 10000; waited += 50, usleep(50 * 1000))
        if (!fakedev::ListeningAddress(18080).empty())
            return pid;
    EndChild(h, pid);
    return 0;
}

}  // namespace tarnwebtest

#endif
