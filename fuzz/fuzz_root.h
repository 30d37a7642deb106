// Shared set-up of the fuzz targets: a private temporary root so that no
// target touches the real system's files, segments or programs.
#ifndef TARN_FUZZ_ROOT_H
#define TARN_FUZZ_ROOT_H

#include <cstdio>
#include <cstdlib>
#include <string>
#include <ftw.h>
#include <sys/stat.h>
#include <unistd.h>

// Creates /tmp/tarnfuzz.XXXXXX with the standard folders and points
// TARN_ROOT at it (before any code reads the environment). There is no
// mplayer-daemon under the root, so a play request cannot start a player.
// TARN_SHM_KEY is derived from the pid so parallel runs do not share
// segments; TARN_LOG_FILE is left unset (log lines go to syslog only).
inline std::string &FuzzRootDir()
{
    static std::string dir;
    return dir;
}

inline int FuzzRemoveEntry(const char *path, const struct stat *, int, struct FTW *)
{
    remove(path);
    return 0;
}

// Removes the root when the fuzzer ends normally.
inline void FuzzRemoveRoot()
{
    if (!FuzzRootDir().empty())
        nftw(FuzzRootDir().c_str(), FuzzRemoveEntry, 16, FTW_DEPTH | FTW_PHYS);
}

inline std::string FuzzMakeRoot()
{
    char dir[] = "/tmp/tarnfuzz.XXXXXX";
    if (mkdtemp(dir) == nullptr) {
        perror("fuzz: mkdtemp");
        abort();
    }
    const char *sub[] = {"/tmp", "/var", "/var/run", "/etc", "/usr", "/usr/tarn", "/usr/tarn/bin",
                         "/usr/tarn/etc", "/usr/tarn/etc/audio", "/usr/tarn/etc/audio/radio",
                         "/usr/tarn/etc.defaults", "/usr/tarn/etc.defaults/audio", "/dev"};
    for (const char *s : sub)
        mkdir((std::string(dir) + s).c_str(), 0755);
    setenv("TARN_ROOT", dir, 1);
    char key[32];
    snprintf(key, sizeof(key), "%d", 0x30000000 + (int)(getpid() & 0xffffff) * 2);
    setenv("TARN_SHM_KEY", key, 1);
    setenv("TARN_AUDIO_OUT", "null", 1);
    unsetenv("TARN_LOG_FILE");
    FuzzRootDir() = dir;
    atexit(FuzzRemoveRoot);
    return dir;
}

#endif
