#include "tools/mplayer-daemon/status_segment.h"

#include "platform/tarn_log.h"
#include "platform/tarn_shm.h"

#include <cstring>
#include <sys/ipc.h>
#include <sys/shm.h>

static const char kLogUnit[] = "mplayer-daemon";

void CopyTextField(char *field, size_t size, const std::string &text)
{
    if (!field || size == 0)
        return;
    size_t n = text.size();
    if (n > size - 1) {
        n = size - 1;
        // Do not end inside a multi-byte character: back up over
        // continuation bytes to the lead byte and drop that character.
        while (n > 0 && (static_cast<unsigned char>(text[n]) & 0xC0) == 0x80)
            --n;
    }
    memcpy(field, text.data(), n);
    memset(field + n, 0, size - n);
}

StatusSegment::StatusSegment() : shm_(nullptr) {}

StatusSegment::~StatusSegment()
{
    Detach();
}

int StatusSegment::Attach(int key)
{
    Detach();
    TarnShmStep failed = TARN_SHM_STEP_NONE;
    void *p = TarnShmAttach(key, sizeof(PlayerStatusShm), TARN_SHM_CREATE, &failed);
    if (failed == TARN_SHM_STEP_GET) {
        TLOG("Failed to get the player status segment. key[%d], size[%d], [%m]", key,
             static_cast<int>(sizeof(PlayerStatusShm)));
        return -1;
    }
    if (!p) {
        TLOG("Failed to attach the player status segment. [%m]");
        return -1;
    }
    shm_ = static_cast<PlayerStatusShm *>(p);
    return 0;
}

void StatusSegment::Detach()
{
    if (shm_) {
        shmdt(shm_);
        shm_ = nullptr;
    }
}

void StatusSegment::SetState(int state)
{
    if (shm_)
        shm_->state = state;
}

int StatusSegment::State() const
{
    return shm_ ? shm_->state : 0;
}

void StatusSegment::StartSong(const std::string &uri)
{
    station_.clear();
    title_.clear();
    if (!shm_)
        return;
    CopyTextField(shm_->currentUri, sizeof(shm_->currentUri), uri);
    shm_->duration = -1;
    shm_->position = 0;
    CopyTextField(shm_->radioStation, sizeof(shm_->radioStation), std::string());
    CopyTextField(shm_->streamTitle, sizeof(shm_->streamTitle), std::string());
}

void StatusSegment::SetDuration(int seconds)
{
    if (shm_ && shm_->duration != seconds)
        shm_->duration = seconds;
}

void StatusSegment::SetPosition(int seconds)
{
    if (shm_ && shm_->position != seconds)
        shm_->position = seconds;
}

void StatusSegment::SetRadioStation(const std::string &name)
{
    if (name == station_)
        return;
    station_ = name;
    if (shm_)
        CopyTextField(shm_->radioStation, sizeof(shm_->radioStation), name);
}

void StatusSegment::SetStreamTitle(const std::string &title)
{
    if (title == title_)
        return;
    title_ = title;
    if (shm_)
        CopyTextField(shm_->streamTitle, sizeof(shm_->streamTitle), title);
}

void StatusSegment::SetVolumeInfo(int volume, bool muted)
{
    if (!shm_)
        return;
    shm_->value4104 = volume;
    shm_->value4108 = muted ? 1 : 0;
}

void StatusSegment::SetPid(int pid)
{
    if (shm_)
        shm_->value4116 = pid;
}

void StatusSegment::ReportFailure(const std::string &reason)
{
    if (!shm_)
        return;
    CopyTextField(shm_->failReason, sizeof(shm_->failReason), reason);
    // The text first: a reader that sees the new serial finds it complete.
    __atomic_thread_fence(__ATOMIC_SEQ_CST);
    volatile int32_t *serial = &shm_->failSerial;
    *serial = *serial + 1;
}

void StatusSegment::ClearFailures()
{
    if (!shm_)
        return;
    shm_->failSerial = 0;
    CopyTextField(shm_->failReason, sizeof(shm_->failReason), std::string());
}
