// mplayer-daemon's side of the player status segment: what is playing, its
// state, duration and position, and for radio streams the station name and
// the stream title. The daemon reads the segment every loop turn; it writes
// only the state word (2 after reading 5). Fields are written one by one
// without a lock: readers tolerate torn values.
#ifndef MPLAYER_STATUS_SEGMENT_H
#define MPLAYER_STATUS_SEGMENT_H

#include "daemon/tarn_types.h"

#include <string>

class StatusSegment {
public:
    StatusSegment();
    ~StatusSegment();

    // Attaches to the segment with this key, creating it (0666) when it does
    // not exist. 0 / -1 (logged); without a segment every write is a no-op.
    int Attach(int key);
    void Detach();
    bool Attached() const { return shm_ != nullptr; }

    void SetState(int state);
    int State() const;
    // Starting a song: URI, duration unknown (-1), position 0, no station
    // or title.
    void StartSong(const std::string &uri);
    void SetDuration(int seconds);
    void SetPosition(int seconds);
    // Station name and stream title of radio streams; written only when
    // they change.
    void SetRadioStation(const std::string &name);
    void SetStreamTitle(const std::string &title);
    // Output volume (0..100), mute flag and process id, kept in the words
    // the daemon does not read (4104, 4108, 4116) for diagnostics.
    void SetVolumeInfo(int volume, bool muted);
    void SetPid(int pid);
    // A song that cannot be played: the reason, then the serial counted up.
    // ClearFailures (at start) empties both.
    void ReportFailure(const std::string &reason);
    void ClearFailures();

private:
    PlayerStatusShm *shm_;
    std::string station_;
    std::string title_;
};

// Copies text into a fixed field, cut at a UTF-8 character boundary so
// that the field stays valid text, always NUL-terminated.
void CopyTextField(char *field, size_t size, const std::string &text);

#endif
