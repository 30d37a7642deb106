// Helpers of the song server and renderer tests: a media library of demo
// songs and the song server as a child process.
#ifndef TARN_TARNWEB_TEST_UTIL_H
#define TARN_TARNWEB_TEST_UTIL_H

#include <arpa/inet.h>
#include <signal.h>
#include <unistd.h>

#include <fstream>
#include <sstream>

#include "platform/medialib.h"
#include "tests/harness/harness.h"

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

// True once something accepts TCP connections on addr:port.
inline bool WaitListening(const char *addr, int port, int timeoutMs)
{
    struct sockaddr_in a = {};
    a.sin_family = AF_INET;
    a.sin_port = htons(static_cast<uint16_t>(port));
    inet_pton(AF_INET, addr, &a.sin_addr);
    for (int waited = 0; waited < timeoutMs; waited += 50, usleep(50 * 1000)) {
        int s = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        bool ok = connect(s, reinterpret_cast<struct sockaddr *>(&a), sizeof(a)) == 0;
        close(s);
        if (ok)
            return true;
    }
    return false;
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

// tarnweb with args, once it listens on addr:port; 0 when it did not start.
inline pid_t StartSongServer(tarntest::Harness &h, std::vector<std::string> args,
                             const char *addr, int port)
{
    args.insert(args.begin(), tarntest::BinPath("tarnweb"));
    pid_t pid = h.Spawn(args, true);
    if (pid > 0 && !WaitListening(addr, port, 10000))
        EndChild(h, pid);
    return pid;
}

}  // namespace tarnwebtest

#endif
