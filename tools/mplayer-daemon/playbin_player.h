// The playing half of mplayer-daemon: one GStreamer playbin that plays one
// URI at a time into an output built once at start-up and kept across
// songs, with the ten-band equalizer in front of the sink. Progress goes to
// the player status segment. Everything runs on the GLib main loop's thread
// except the WAV output's sample callback.
#ifndef MPLAYER_PLAYBIN_PLAYER_H
#define MPLAYER_PLAYBIN_PLAYER_H

#include "tools/mplayer-daemon/command_parser.h"
#include "tools/mplayer-daemon/status_segment.h"
#include "tools/mplayer-daemon/wav_writer.h"

#include <gst/app/gstappsink.h>
#include <gst/gst.h>

#include <string>

class PlaybinPlayer {
public:
    explicit PlaybinPlayer(StatusSegment *segment);
    ~PlaybinPlayer();

    // Builds the pipeline. audioOut: "default", "null" or "wav:PATH".
    // 0 / -1 (logged).
    int Init(const std::string &audioOut, int volume, const double gains[MPLAYER_EQ_BANDS]);

    // Plays a URI or a local path from its start (state 2). A song that
    // cannot be played is reported as ended (5) after a short pause so that
    // the daemon moves on.
    int Load(const std::string &uriText);
    void TogglePause();
    // Relative seek in seconds from the current position.
    void SeekRelative(int seconds);
    void SetVolume(int volume);
    void ToggleMute();
    void SetEqualizer(const double gains[MPLAYER_EQ_BANDS]);

    // Stops playing and completes the output (WAV header). Idempotent.
    void Shutdown();

private:
    enum Mode { IDLE, PLAYING, PAUSED, ENDED };

    static gboolean OnBusMessage(GstBus *bus, GstMessage *msg, gpointer self);
    static gboolean OnTick(gpointer self);
    static gboolean OnFailedSongEnd(gpointer self);
    static GstFlowReturn OnNewSample(GstAppSink *sink, gpointer self);

    GstElement *BuildSink(const std::string &audioOut);
    // The output with the equalizer in front of sink.
    GstElement *BuildOutput(GstElement *sink);
    void HandleTags(GstTagList *tags);
    void HandleEos();
    void HandleError(GstMessage *msg);
    // Reports why the current song cannot be played (a local file's own
    // problem when it has one, else what GStreamer said).
    void ReportFailure(const char *what);
    void UpdateProgress();
    void StartTick();
    void StopTimers();

    StatusSegment *segment_;
    GstElement *playbin_;
    GstElement *equalizer_;
    guint busWatch_;
    guint tickId_;
    guint failId_;
    WavWriter wav_;
    bool wavOut_;
    std::string uriText_;
    bool isStream_;
    Mode mode_;
    bool buffering_;
    gint64 lastPosition_;
    int volume_;
    bool muted_;
    bool shutDown_;
};

#endif
