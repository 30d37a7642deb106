// Plays the local queue through mplayer-daemon.
#ifndef TARN_LOCALPLAYER_H
#define TARN_LOCALPLAYER_H

#include <ctime>
#include <string>
#include <vector>

#include <json/json.h>

#include "wire/tarn_wire.h"

class Playlist;

class LocalPlayer {
public:
    LocalPlayer();
    ~LocalPlayer();
    LocalPlayer(const LocalPlayer &) = delete;
    LocalPlayer &operator=(const LocalPlayer &) = delete;

    int AttachMplayerFd(int fd);
    int Poll(PlayerStatusShm *segment);
    int PublishStatus(PublishedStatusShm *segment);
    int HandleAction(const ControlRequest *request, Json::Value &reply);
    int PlayPause();
    int Stop();
    int Next(bool automatic);
    int Previous();
    int PlayIndex(const char *text);
    int Seek(const char *text);
    int Mute();
    int SetVolume(int volume);
    int GetStatusJson(Json::Value &reply);
    int SetEqualizer(const char *text);
    void SaveVolumeAndKill();
    void KillByName();
    int GetCurrentSong(std::string &path, std::string &title);

    Playlist *GetPlaylist() { return playlist; }
    unsigned GetState() const { return state; }
    int GetVolume() const { return volume; }
    int GetMplayerFd() const { return mplayerFd; }
    int GetPosition() const { return position; }
    const std::string &GetCurrentUri() const { return currentUri; }
    // Why playback last stopped or skipped a song on its own ("" when it did
    // not since the last play request); the count of such errors since start.
    const std::string &GetLastError() const { return lastError; }
    int GetErrorCount() const { return errorCount; }

    // How soon the loop must poll again, in ms: often while a song plays
    // (its end is acted on within a poll), seldom while paused, never (-1)
    // while mplayer-daemon is not connected.
    int PollIntervalMs() const;
    // mplayer-daemon's connection was closed by its end: the player stops,
    // with the reason kept for status. The child is reaped.
    void OnMplayerClosed();

    // The "loadfile" command text for uri: backslashes doubled, double
    // quotes passed through as they are.
    static std::string LoadFileCommand(const std::string &uri);

private:
    int StartMplayer(const std::string &uri);
    int LoadFile(const std::string &uri);
    int SendCommand(const char *bytes, size_t length);
    // Sends text in a NUL-padded 2048-byte buffer.
    int SendPadded(const char *text);
    // Next (forward) or Previous, skipping songs the player cannot play.
    int Step(bool forward, bool automatic);
    bool IsMplayerAlive();
    void KillMplayer();
    void CloseMplayerFd();

    uint32_t state;
    Playlist *playlist;
    std::string currentUri;
    int32_t duration;
    int32_t position;
    int32_t mplayerFd;
    std::string streamTitle;
    std::string radioStation;
    time_t lastVolumeCheck;
    int32_t volume;
    std::string lastError;
    int32_t errorCount;
    int32_t failSerialSeen;  // mplayer-daemon's failure reports already taken
    unsigned failedInARow;   // songs that failed since one last played
    bool muted;              // as mplayer-daemon last reported it
    // A player process started and not yet connected: a second start would
    // kill it half-way; the song asked for meanwhile is loaded once it
    // connects.
    // Commands with a value travel in a fixed buffer of this size, NUL-padded.
    static constexpr size_t kPaddedCommandSize = 2048;
    int64_t startedAtMs;     // 0: none waiting
    std::string pendingUri;
    bool StartPending();
    void SetError(const std::string &why);
};

#endif
