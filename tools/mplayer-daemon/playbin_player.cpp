#include "tools/mplayer-daemon/playbin_player.h"

#include "platform/tarn_log.h"

#include <cerrno>
#include <cstring>
#include <unistd.h>

static const char kLogUnit[] = "mplayer-daemon";

namespace {

// The WAV output: one format for every song so that they fit in one file.
const int kWavRate = 44100;
const int kWavChannels = 2;
// Progress is written into the segment this often while a song is loaded.
const guint kTickMs = 250;
// A song that fails is reported as ended after this pause, so that a queue
// of unplayable entries does not spin.
const guint kFailedSongDelayMs = 1000;

int ToSeconds(gint64 ns)
{
    if (ns < 0)
        return -1;
    return static_cast<int>(ns / GST_SECOND);
}

GstElement *MakeElement(const char *factory, const char *name)
{
    GstElement *e = gst_element_factory_make(factory, name);
    if (!e)
        TarnLog("%s:%d GStreamer element [%s] is missing; install the GStreamer plugin packages.",
                kLogUnit, __LINE__, factory);
    return e;
}

// A bin of elements linked in a row, with ghost pads at both ends (or only
// a sink pad when the last element is a sink).
GstElement *MakeChainBin(const char *name, GstElement **elems, int count)
{
    GstElement *bin = gst_bin_new(name);
    for (int i = 0; i < count; ++i)
        gst_bin_add(GST_BIN(bin), elems[i]);
    for (int i = 0; i + 1 < count; ++i) {
        if (!gst_element_link(elems[i], elems[i + 1])) {
            TarnLog("%s:%d Failed to link the elements of [%s].", kLogUnit, __LINE__, name);
            gst_object_unref(bin);
            return nullptr;
        }
    }
    GstPad *sinkPad = gst_element_get_static_pad(elems[0], "sink");
    gst_element_add_pad(bin, gst_ghost_pad_new("sink", sinkPad));
    gst_object_unref(sinkPad);
    GstPad *srcPad = gst_element_get_static_pad(elems[count - 1], "src");
    if (srcPad) {
        gst_element_add_pad(bin, gst_ghost_pad_new("src", srcPad));
        gst_object_unref(srcPad);
    }
    return bin;
}

std::string TagString(GstTagList *tags, const char *tag)
{
    gchar *v = nullptr;
    if (!gst_tag_list_get_string(tags, tag, &v) || !v)
        return std::string();
    std::string s(v);
    g_free(v);
    return s;
}

}  // namespace

PlaybinPlayer::PlaybinPlayer(StatusSegment *segment)
    : segment_(segment), playbin_(nullptr), equalizer_(nullptr), busWatch_(0), tickId_(0),
      failId_(0), wavOut_(false), isStream_(false), mode_(IDLE), buffering_(false),
      lastPosition_(0), volume_(100), muted_(false), shutDown_(false)
{
}

PlaybinPlayer::~PlaybinPlayer()
{
    Shutdown();
    if (busWatch_)
        g_source_remove(busWatch_);
    if (playbin_)
        gst_object_unref(playbin_);
}

GstElement *PlaybinPlayer::BuildOutput(GstElement *sink)
{
    // The equalizer sits right in front of the sink, behind playbin's own
    // output queue (up to a second of audio), so that a new setting is heard
    // as quickly as a volume change.
    GstElement *elems[4] = {MakeElement("audioconvert", nullptr),
                            MakeElement("equalizer-10bands", "equalizer"),
                            MakeElement("audioconvert", nullptr), sink};
    if (!elems[0] || !elems[1] || !elems[2]) {
        for (int i = 0; i < 3; ++i)
            if (elems[i])
                gst_object_unref(elems[i]);
        TLOG("Playing without the equalizer.");
        return sink;
    }
    equalizer_ = elems[1];
    GstElement *bin = MakeChainBin("audio-output", elems, 4);
    if (!bin)
        equalizer_ = nullptr;
    return bin;
}

GstElement *PlaybinPlayer::BuildSink(const std::string &audioOut)
{
    if (audioOut.compare(0, 4, "wav:") == 0) {
        std::string path = audioOut.substr(4);
        if (path.empty()) {
            TLOG("Audio output [%s] names no file.", audioOut.c_str());
            return nullptr;
        }
        if (wav_.Open(path, kWavRate, kWavChannels) != 0)
            return nullptr;
        GstElement *elems[4] = {MakeElement("audioconvert", nullptr),
                                MakeElement("audioresample", nullptr),
                                MakeElement("capsfilter", nullptr),
                                MakeElement("appsink", "wav-sink")};
        for (GstElement *e : elems) {
            if (!e) {
                for (GstElement *f : elems)
                    if (f)
                        gst_object_unref(f);
                return nullptr;
            }
        }
        GstCaps *caps = gst_caps_new_simple("audio/x-raw", "format", G_TYPE_STRING, "S16LE",
                                            "rate", G_TYPE_INT, kWavRate, "channels", G_TYPE_INT,
                                            kWavChannels, "layout", G_TYPE_STRING, "interleaved",
                                            nullptr);
        g_object_set(elems[2], "caps", caps, nullptr);
        gst_caps_unref(caps);
        // sync: samples arrive in real time, as on a sound card.
        g_object_set(elems[3], "sync", TRUE, "enable-last-sample", FALSE, nullptr);
        GstAppSinkCallbacks callbacks;
        memset(&callbacks, 0, sizeof(callbacks));
        callbacks.new_sample = &PlaybinPlayer::OnNewSample;
        gst_app_sink_set_callbacks(GST_APP_SINK(elems[3]), &callbacks, this, nullptr);
        wavOut_ = true;
        return MakeChainBin("wav-out", elems, 4);
    }
    if (audioOut != "null" && audioOut != "default")
        TLOG("Unknown audio output [%s]; using the default output.", audioOut.c_str());
    if (audioOut != "null") {
        GstElement *sink = MakeElement("autoaudiosink", "audio-out");
        if (sink) {
            if (gst_element_set_state(sink, GST_STATE_READY) != GST_STATE_CHANGE_FAILURE) {
                gst_element_set_state(sink, GST_STATE_NULL);
                return sink;
            }
            gst_element_set_state(sink, GST_STATE_NULL);
            gst_object_unref(sink);
        }
        TLOG("No usable sound device; playing to the null output.");
    }
    GstElement *sink = MakeElement("fakesink", "null-out");
    if (sink)
        g_object_set(sink, "sync", TRUE, nullptr);
    return sink;
}

int PlaybinPlayer::Init(const std::string &audioOut, int volume,
                        const double gains[MPLAYER_EQ_BANDS])
{
    playbin_ = MakeElement("playbin", "player");
    if (!playbin_)
        return -1;
    gst_object_ref_sink(playbin_);
    // Audio only: no video or subtitle branches.
    gint flags = 0;
    g_object_get(playbin_, "flags", &flags, nullptr);
    flags &= ~((1 << 0) | (1 << 2));  // GST_PLAY_FLAG_VIDEO, GST_PLAY_FLAG_TEXT
    g_object_set(playbin_, "flags", flags, nullptr);

    GstElement *sink = BuildSink(audioOut);
    if (!sink)
        return -1;
    GstElement *out = BuildOutput(sink);
    if (!out)
        return -1;
    g_object_set(playbin_, "audio-sink", out, nullptr);

    GstBus *bus = gst_element_get_bus(playbin_);
    busWatch_ = gst_bus_add_watch(bus, &PlaybinPlayer::OnBusMessage, this);
    gst_object_unref(bus);

    SetVolume(volume);
    SetEqualizer(gains);
    return 0;
}

int PlaybinPlayer::Load(const std::string &uriText)
{
    if (!playbin_ || shutDown_)
        return -1;
    StopTimers();
    gst_element_set_state(playbin_, GST_STATE_READY);
    // Messages still queued from the previous song must not end this one.
    GstBus *bus = gst_element_get_bus(playbin_);
    gst_bus_set_flushing(bus, TRUE);
    gst_bus_set_flushing(bus, FALSE);
    gst_object_unref(bus);

    uriText_ = uriText;
    std::string uri;
    if (gst_uri_is_valid(uriText.c_str())) {
        uri = uriText;
    } else {
        GError *err = nullptr;
        gchar *u = gst_filename_to_uri(uriText.c_str(), &err);
        if (u) {
            uri = u;
            g_free(u);
        } else {
            g_clear_error(&err);
        }
    }
    gchar *scheme = uri.empty() ? nullptr : gst_uri_get_protocol(uri.c_str());
    isStream_ = scheme && g_ascii_strcasecmp(scheme, "file") != 0;
    g_free(scheme);

    segment_->StartSong(uriText);
    segment_->SetState(PLAYER_STATE_PLAYING);
    lastPosition_ = 0;
    buffering_ = false;
    mode_ = PLAYING;

    if (uri.empty()) {
        TLOG("Cannot play [%s]: not a URI or file path.", uriText.c_str());
        ReportFailure("not a URI or file path");
        mode_ = ENDED;
        failId_ = g_timeout_add(kFailedSongDelayMs, &PlaybinPlayer::OnFailedSongEnd, this);
        return -1;
    }
    g_object_set(playbin_, "uri", uri.c_str(), nullptr);
    if (gst_element_set_state(playbin_, GST_STATE_PLAYING) == GST_STATE_CHANGE_FAILURE) {
        // The element that failed has posted why; end the song with it.
        GstBus *b = gst_element_get_bus(playbin_);
        GstMessage *msg = gst_bus_pop_filtered(b, GST_MESSAGE_ERROR);
        gst_object_unref(b);
        if (msg) {
            HandleError(msg);
            gst_message_unref(msg);
        } else {
            TLOG("Failed to start playing [%s].", uriText.c_str());
            ReportFailure("the player could not start it");
            mode_ = ENDED;
            gst_element_set_state(playbin_, GST_STATE_NULL);
            failId_ = g_timeout_add(kFailedSongDelayMs, &PlaybinPlayer::OnFailedSongEnd, this);
        }
        return -1;
    }
    StartTick();
    return 0;
}

void PlaybinPlayer::TogglePause()
{
    if (!playbin_)
        return;
    if (mode_ == PLAYING) {
        mode_ = PAUSED;
        gst_element_set_state(playbin_, GST_STATE_PAUSED);
        segment_->SetState(PLAYER_STATE_PAUSED);
    } else if (mode_ == PAUSED) {
        mode_ = PLAYING;
        if (!buffering_)
            gst_element_set_state(playbin_, GST_STATE_PLAYING);
        segment_->SetState(PLAYER_STATE_PLAYING);
    }
}

void PlaybinPlayer::SeekRelative(int seconds)
{
    if (!playbin_ || (mode_ != PLAYING && mode_ != PAUSED))
        return;
    GstQuery *q = gst_query_new_seeking(GST_FORMAT_TIME);
    gboolean seekable = FALSE;
    if (gst_element_query(playbin_, q))
        gst_query_parse_seeking(q, nullptr, &seekable, nullptr, nullptr);
    gst_query_unref(q);
    if (!seekable) {
        TLOG("Seek by %d s ignored: [%s] is not seekable.", seconds, uriText_.c_str());
        return;
    }
    gint64 pos = 0;
    if (!gst_element_query_position(playbin_, GST_FORMAT_TIME, &pos) || pos < 0)
        pos = lastPosition_;
    gint64 target = pos + static_cast<gint64>(seconds) * GST_SECOND;
    if (target < 0)
        target = 0;
    gint64 dur = -1;
    if (gst_element_query_duration(playbin_, GST_FORMAT_TIME, &dur) && dur > 0 && target > dur)
        target = dur;
    if (!gst_element_seek_simple(playbin_, GST_FORMAT_TIME,
                                 static_cast<GstSeekFlags>(GST_SEEK_FLAG_FLUSH |
                                                           GST_SEEK_FLAG_ACCURATE),
                                 target)) {
        TLOG("Seek by %d s failed in [%s].", seconds, uriText_.c_str());
        return;
    }
    lastPosition_ = target;
    segment_->SetPosition(ToSeconds(target));
}

void PlaybinPlayer::SetVolume(int volume)
{
    volume_ = volume < 0 ? 0 : (volume > 100 ? 100 : volume);
    if (playbin_)
        g_object_set(playbin_, "volume", volume_ / 100.0, nullptr);
    segment_->SetVolumeInfo(volume_, muted_);
}

void PlaybinPlayer::ToggleMute()
{
    muted_ = !muted_;
    if (playbin_)
        g_object_set(playbin_, "mute", muted_ ? TRUE : FALSE, nullptr);
    segment_->SetVolumeInfo(volume_, muted_);
}

void PlaybinPlayer::SetEqualizer(const double gains[MPLAYER_EQ_BANDS])
{
    if (!equalizer_ || !gains)
        return;
    for (int i = 0; i < MPLAYER_EQ_BANDS; ++i) {
        double g = gains[i];
        if (!(g >= MPLAYER_EQ_MIN_DB))
            g = (g > 0) ? MPLAYER_EQ_MAX_DB : MPLAYER_EQ_MIN_DB;
        if (g > MPLAYER_EQ_MAX_DB)
            g = MPLAYER_EQ_MAX_DB;
        char name[16];
        snprintf(name, sizeof(name), "band%d", i);
        g_object_set(equalizer_, name, g, nullptr);
    }
}

void PlaybinPlayer::Shutdown()
{
    if (shutDown_)
        return;
    shutDown_ = true;
    StopTimers();
    if (playbin_)
        gst_element_set_state(playbin_, GST_STATE_NULL);
    if (wavOut_)
        wav_.Close();
    mode_ = IDLE;
}

void PlaybinPlayer::StartTick()
{
    if (!tickId_)
        tickId_ = g_timeout_add(kTickMs, &PlaybinPlayer::OnTick, this);
}

void PlaybinPlayer::StopTimers()
{
    if (tickId_) {
        g_source_remove(tickId_);
        tickId_ = 0;
    }
    if (failId_) {
        g_source_remove(failId_);
        failId_ = 0;
    }
}

void PlaybinPlayer::UpdateProgress()
{
    gint64 pos = -1;
    gint64 dur = -1;
    // During a seek the position query fails for a moment: keep the last.
    if (gst_element_query_position(playbin_, GST_FORMAT_TIME, &pos) && pos >= 0)
        lastPosition_ = pos;
    if (!gst_element_query_duration(playbin_, GST_FORMAT_TIME, &dur) || dur <= 0)
        dur = -1;
    int durSec = dur > 0 ? static_cast<int>((dur + GST_SECOND / 2) / GST_SECOND) : -1;
    int posSec = ToSeconds(lastPosition_);
    if (durSec >= 0 && posSec > durSec)
        posSec = durSec;
    segment_->SetDuration(durSec);
    segment_->SetPosition(posSec);
}

gboolean PlaybinPlayer::OnTick(gpointer p)
{
    PlaybinPlayer *self = static_cast<PlaybinPlayer *>(p);
    if (self->mode_ != PLAYING && self->mode_ != PAUSED) {
        self->tickId_ = 0;
        return G_SOURCE_REMOVE;
    }
    self->UpdateProgress();
    return G_SOURCE_CONTINUE;
}

gboolean PlaybinPlayer::OnFailedSongEnd(gpointer p)
{
    PlaybinPlayer *self = static_cast<PlaybinPlayer *>(p);
    self->failId_ = 0;
    self->segment_->SetState(PLAYER_STATE_ENDED);
    return G_SOURCE_REMOVE;
}

GstFlowReturn PlaybinPlayer::OnNewSample(GstAppSink *sink, gpointer p)
{
    PlaybinPlayer *self = static_cast<PlaybinPlayer *>(p);
    GstSample *sample = gst_app_sink_pull_sample(sink);
    if (!sample)
        return GST_FLOW_EOS;
    GstBuffer *buf = gst_sample_get_buffer(sample);
    GstMapInfo map;
    if (buf && gst_buffer_map(buf, &map, GST_MAP_READ)) {
        self->wav_.Write(map.data, map.size);
        gst_buffer_unmap(buf, &map);
    }
    gst_sample_unref(sample);
    return GST_FLOW_OK;
}

void PlaybinPlayer::HandleEos()
{
    if (mode_ != PLAYING && mode_ != PAUSED)
        return;
    UpdateProgress();
    gint64 dur = -1;
    if (gst_element_query_duration(playbin_, GST_FORMAT_TIME, &dur) && dur > 0)
        segment_->SetPosition(static_cast<int>((dur + GST_SECOND / 2) / GST_SECOND));
    mode_ = ENDED;
    StopTimers();
    gst_element_set_state(playbin_, GST_STATE_READY);
    segment_->SetState(PLAYER_STATE_ENDED);
}

void PlaybinPlayer::HandleError(GstMessage *msg)
{
    GError *err = nullptr;
    gchar *debug = nullptr;
    gst_message_parse_error(msg, &err, &debug);
    if (mode_ == PLAYING || mode_ == PAUSED) {
        TLOG("Failed to play [%s]: %s", uriText_.c_str(), err ? err->message : "unknown error");
        ReportFailure(err ? err->message : "unknown error");
        mode_ = ENDED;
        StopTimers();
        gst_element_set_state(playbin_, GST_STATE_NULL);
        failId_ = g_timeout_add(kFailedSongDelayMs, &PlaybinPlayer::OnFailedSongEnd, this);
    }
    g_clear_error(&err);
    g_free(debug);
}

void PlaybinPlayer::ReportFailure(const char *what)
{
    std::string why = what ? what : "unknown error";
    if (!isStream_) {
        std::string path = uriText_;
        if (g_str_has_prefix(uriText_.c_str(), "file:")) {
            gchar *local = g_filename_from_uri(uriText_.c_str(), nullptr, nullptr);
            path = local ? local : "";
            g_free(local);
        }
        if (!path.empty() && access(path.c_str(), R_OK) != 0)
            why = strerror(errno);
    }
    segment_->ReportFailure("cannot play " + uriText_ + ": " + why);
}

void PlaybinPlayer::HandleTags(GstTagList *tags)
{
    // Only network streams carry a station and a stream title; a local
    // file's own tags are the media library's business.
    if (!isStream_ || (mode_ != PLAYING && mode_ != PAUSED))
        return;
    std::string station = TagString(tags, GST_TAG_ORGANIZATION);
    if (!station.empty())
        segment_->SetRadioStation(station);
    std::string title = TagString(tags, GST_TAG_TITLE);
    if (!title.empty())
        segment_->SetStreamTitle(title);
}

gboolean PlaybinPlayer::OnBusMessage(GstBus *bus, GstMessage *msg, gpointer p)
{
    PlaybinPlayer *self = static_cast<PlaybinPlayer *>(p);
    switch (GST_MESSAGE_TYPE(msg)) {
    case GST_MESSAGE_EOS:
        self->HandleEos();
        break;
    case GST_MESSAGE_ERROR:
        self->HandleError(msg);
        break;
    case GST_MESSAGE_TAG: {
        GstTagList *tags = nullptr;
        gst_message_parse_tag(msg, &tags);
        if (tags) {
            self->HandleTags(tags);
            gst_tag_list_unref(tags);
        }
        break;
    }
    case GST_MESSAGE_BUFFERING: {
        // Network streams: hold playback while the buffer refills.
        gint percent = 100;
        gst_message_parse_buffering(msg, &percent);
        if (self->mode_ != PLAYING && self->mode_ != PAUSED)
            break;
        if (percent < 100 && !self->buffering_) {
            self->buffering_ = true;
            if (self->mode_ == PLAYING)
                gst_element_set_state(self->playbin_, GST_STATE_PAUSED);
        } else if (percent >= 100 && self->buffering_) {
            self->buffering_ = false;
            if (self->mode_ == PLAYING)
                gst_element_set_state(self->playbin_, GST_STATE_PLAYING);
        }
        break;
    }
    case GST_MESSAGE_CLOCK_LOST:
        if (self->mode_ == PLAYING && !self->buffering_) {
            gst_element_set_state(self->playbin_, GST_STATE_PAUSED);
            gst_element_set_state(self->playbin_, GST_STATE_PLAYING);
        }
        break;
    case GST_MESSAGE_DURATION_CHANGED:
        if (self->mode_ == PLAYING || self->mode_ == PAUSED)
            self->UpdateProgress();
        break;
    default:
        break;
    }
    return G_SOURCE_CONTINUE;
}
