// One continuous WAV file (16-bit little-endian PCM) that every song played
// is appended to. The header is brought up to date after each block, so the
// file is a valid WAV at any moment, also when the process is killed.
#ifndef MPLAYER_WAV_WRITER_H
#define MPLAYER_WAV_WRITER_H

#include <cstddef>
#include <cstdint>
#include <mutex>
#include <string>

class WavWriter {
public:
    WavWriter();
    ~WavWriter();

    // Creates (truncates) the file and writes an empty header. 0 / -1.
    int Open(const std::string &path, int rate, int channels);
    // Appends interleaved S16LE frames. 0 / -1 (logged once per failure run).
    int Write(const void *data, size_t len);
    // Final header update and close. 0 / -1.
    int Close();

    uint64_t DataBytes() const;

private:
    int UpdateHeader();

    mutable std::mutex mutex_;
    int fd_;
    int rate_;
    int channels_;
    uint64_t dataBytes_;
    bool failed_;
    std::string path_;
};

#endif
