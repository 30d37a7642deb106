// Audio output settings: equalizer profiles, the saved output volume, the
// OSS mixer devices, the sound driver's volume entry and the test of which
// files the local player can play.
//
// All functions are stateless: they read the configuration afresh and keep no
// descriptor open between calls. Fixed paths are placed through TarnPath().
#ifndef TARN_AUDIO_INFO_H
#define TARN_AUDIO_INFO_H

#include <cstddef>

// Profile files, searched in this order.
#define TARN_EQ_SYSTEM_FILE "/usr/tarn/etc.defaults/audio/equalizer.system"
#define TARN_EQ_USER_FILE "/usr/tarn/etc/audio/equalizer.user"
// The sound driver's volume entry.
#define TARN_PROC_VOLUME "/proc/asound/tarn_audio_volume"
// Mixer and audio devices: the base path plus "" for device 0, "1".."7".
#define TARN_MIXER_BASE "/dev/mixer"
#define TARN_DSP_BASE "/dev/dsp"
#define TARN_MIXER_MAX_DEVICE 7

// The neutral gains of the ten equalizer bands.
#define TARN_EQ_NEUTRAL "0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0"

// Looks the profile name up in one profile file ("name:gains" per line, the
// last colon separating the two). A line whose name is a prefix of the wanted
// name matches; the first matching line wins.
// 1 found (trimmed gains in out), 0 not in this file, -1 error (file cannot
// be opened, illegal line, bad arguments).
int EqProfileLookup(const char *path, const char *name, char *out, size_t size);

// The gains of the default profile named in the configuration, when the
// equalizer is enabled ("audio_enable_equalizer" is exactly "yes"): system
// profiles first, then the user's. 1 found, 0 no default profile applies,
// -1 error (a failure on the system file; the user file is then not read).
int EqDefaultProfileGet(char *out, size_t size);

// Whether the local player can play path: mode 0 accepts everything, mode 2
// checks the short list of extensions, any other mode the full list; URLs
// starting with "http" are always accepted. 1 playable, 0 not.
int AudioIsSupportedFile(int mode, const char *path);

// The highest-numbered mixer device that opens (7 down to 0): its number,
// with its mixer and audio device paths written into the buffers that are
// not null; -1 when none opens.
int MixerFindDevice(char *mixerPath, size_t mixerSize, char *dspPath, size_t dspSize);

// Volume 0 to 100 of the chosen mixer (PCM channel when present, else the
// lowest channel); 0 when the mixer has no channel; -1 on failure.
int MixerGetVolume();

// Sets the volume (clamped to 0..100) of one mixer device. 0 or -1.
int MixerSetVolume(int device, int volume);

// Sets the volume on every mixer device 7 down to 0. 0 if any took it.
int MixerSetVolumeAll(int volume);

// The saved volume ("audio_volume" in the configuration), or -1.
int VolumeConfGet();

// Saves the volume (clamped to 0..100). 0 or -1.
int VolumeConfSet(int volume);

// Sets every mixer to the saved volume. 0 or -1.
int VolumeApplySaved();

// Saves the volume the sound driver reports in its proc entry. 0 or -1.
int VolumeSyncFromProc();

// ---------------------------------------------------------------------------
// Device access of the mixer functions. The defaults are the system calls;
// tests install their own to stand in for a sound card.
struct MixerOps {
    int (*open)(const char *path, int flags);
    int (*ioctl)(int fd, unsigned long request, void *arg);
    int (*close)(int fd);
};

// Installs ops (copied); null restores the system calls.
void MixerSetOps(const MixerOps *ops);

#endif
