#include "tools/mplayer-daemon/wav_writer.h"

#include "platform/tarn_log.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <unistd.h>

static const char kLogUnit[] = "mplayer-daemon";

namespace {

// RIFF sizes are 32-bit; the data chunk stops growing below that limit.
const uint64_t kMaxData = 0xFFFFFFFFull - 36 - 4096;

void Put32(unsigned char *p, uint32_t v)
{
    p[0] = v & 0xFF;
    p[1] = (v >> 8) & 0xFF;
    p[2] = (v >> 16) & 0xFF;
    p[3] = (v >> 24) & 0xFF;
}

void Put16(unsigned char *p, uint16_t v)
{
    p[0] = v & 0xFF;
    p[1] = (v >> 8) & 0xFF;
}

int WriteAll(int fd, const void *data, size_t len, off_t at)
{
    const char *p = static_cast<const char *>(data);
    while (len > 0) {
        ssize_t n = pwrite(fd, p, len, at);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0)
            return -1;
        p += n;
        len -= static_cast<size_t>(n);
        at += n;
    }
    return 0;
}

}  // namespace

WavWriter::WavWriter() : fd_(-1), rate_(0), channels_(0), dataBytes_(0), failed_(false) {}

WavWriter::~WavWriter()
{
    Close();
}

int WavWriter::Open(const std::string &path, int rate, int channels)
{
    std::lock_guard<std::mutex> lock(mutex_);
    if (fd_ >= 0)
        close(fd_);
    path_ = path;
    rate_ = rate;
    channels_ = channels;
    dataBytes_ = 0;
    failed_ = false;
    fd_ = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd_ < 0) {
        TLOG("Failed to create WAV output [%s]. (%m)", path.c_str());
        return -1;
    }
    unsigned char h[44];
    memcpy(h, "RIFF", 4);
    Put32(h + 4, 36);
    memcpy(h + 8, "WAVEfmt ", 8);
    Put32(h + 16, 16);
    Put16(h + 20, 1);  // PCM
    Put16(h + 22, static_cast<uint16_t>(channels));
    Put32(h + 24, static_cast<uint32_t>(rate));
    Put32(h + 28, static_cast<uint32_t>(rate * channels * 2));
    Put16(h + 32, static_cast<uint16_t>(channels * 2));
    Put16(h + 34, 16);
    memcpy(h + 36, "data", 4);
    Put32(h + 40, 0);
    if (WriteAll(fd_, h, sizeof(h), 0) != 0) {
        TLOG("Failed to write WAV header [%s]. (%m)", path.c_str());
        close(fd_);
        fd_ = -1;
        return -1;
    }
    return 0;
}

int WavWriter::UpdateHeader()
{
    unsigned char v[4];
    Put32(v, static_cast<uint32_t>(36 + dataBytes_));
    if (WriteAll(fd_, v, 4, 4) != 0)
        return -1;
    Put32(v, static_cast<uint32_t>(dataBytes_));
    return WriteAll(fd_, v, 4, 40);
}

int WavWriter::Write(const void *data, size_t len)
{
    std::lock_guard<std::mutex> lock(mutex_);
    if (fd_ < 0)
        return -1;
    size_t frame = static_cast<size_t>(channels_) * 2;
    len -= len % frame;
    if (len == 0)
        return 0;
    if (dataBytes_ + len > kMaxData) {
        if (!failed_)
            TLOG("WAV output [%s] is full; further audio is not written.", path_.c_str());
        failed_ = true;
        return -1;
    }
    if (WriteAll(fd_, data, len, static_cast<off_t>(44 + dataBytes_)) != 0) {
        if (!failed_)
            TLOG("Failed to write WAV output [%s]. (%m)", path_.c_str());
        failed_ = true;
        return -1;
    }
    dataBytes_ += len;
    failed_ = false;
    return UpdateHeader();
}

int WavWriter::Close()
{
    std::lock_guard<std::mutex> lock(mutex_);
    if (fd_ < 0)
        return 0;
    int rc = UpdateHeader();
    if (fsync(fd_) != 0 && errno != EINVAL)
        rc = -1;
    if (close(fd_) != 0)
        rc = -1;
    fd_ = -1;
    if (rc != 0)
        TLOG("Failed to finish WAV output [%s]. (%m)", path_.c_str());
    return rc;
}

uint64_t WavWriter::DataBytes() const
{
    std::lock_guard<std::mutex> lock(mutex_);
    return dataBytes_;
}
