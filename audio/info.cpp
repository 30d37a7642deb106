#include "audio/info.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <linux/soundcard.h>
#include <string>
#include <strings.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tlibc_conf.h"

// The equalizer lookup's messages keep the unit name and line numbers that
// log readers match on.
static const char kEqLogUnit[] = "ctrl";

namespace {

const char *const kFullList[] = {"mp3", "m4a", "ogg", "aac", "wma", "flac", "aiff", "aif", "mp1",
                                 "mp2", "mpa", "wav", "ac3", "ra",  "ram", "m4p",  "m4b",  "ape"};
const char *const kShortList[] = {"mp3", "m4a", "m4b"};

const char kKeyVolume[] = "audio_volume";
const char kKeyEqEnable[] = "audio_enable_equalizer";
const char kKeyEqDefault[] = "audio_default_equalizer";
const char kVolumeLineFormat[] = "%s=\"%s\"\n";

int SysOpen(const char *path, int flags)
{
    return open(path, flags | O_CLOEXEC);
}

int SysIoctl(int fd, unsigned long request, void *arg)
{
    return ioctl(fd, request, arg);
}

int SysClose(int fd)
{
    return close(fd);
}

const MixerOps kSystemOps = {SysOpen, SysIoctl, SysClose};
MixerOps g_ops = kSystemOps;

std::string DevicePath(const char *base, int device)
{
    std::string path = TarnPath(base);
    if (device > 0)
        path += static_cast<char>('0' + device);
    return path;
}

int Clamp(int volume)
{
    if (volume < 0)
        return 0;
    if (volume > 100)
        return 100;
    return volume;
}

// The channel to read and write: PCM when the mixer has it, else the lowest
// channel present; -1 when the mask names none.
int ChooseChannel(int mask)
{
    if (mask & (1 << SOUND_MIXER_PCM))
        return SOUND_MIXER_PCM;
    for (int ch = 0; ch < SOUND_MIXER_NRDEVICES; ++ch) {
        if (mask & (1 << ch))
            return ch;
    }
    return -1;
}

std::string ConfPath()
{
    return TarnPath(TARN_INFO_CONF);
}

}  // namespace

void MixerSetOps(const MixerOps *ops)
{
    g_ops = ops ? *ops : kSystemOps;
}

int EqProfileLookup(const char *path, const char *name, char *out, size_t size)
{
    if (!path || !name || !out || size == 0)
        return -1;
    FILE *fp = fopen(path, "r");
    if (!fp)
        return -1;
    char line[1024];
    int result = 0;
    while (fgets(line, sizeof(line), fp)) {
        char *colon = strrchr(line, ':');
        if (!colon) {
            line[strcspn(line, "\r\n")] = '\0';
            TarnLog("%s:%d The EQ profile [%s] is illegal.", kEqLogUnit, 529, line);
            result = -1;
            break;
        }
        // Only as many characters as the line's name has are compared: a
        // line whose name is a prefix of the wanted one matches.
        size_t nameLen = static_cast<size_t>(colon - line);
        if (strncmp(line, name, nameLen) != 0)
            continue;
        snprintf(out, size, "%s", colon + 1);
        if (TLIBCStrTrimSpace(out, 0) < 0) {
            TarnLog("%s:%d Failed to trim [%s].", kEqLogUnit, 535, out);
            result = -1;
        } else {
            result = 1;
        }
        break;
    }
    fclose(fp);
    return result;
}

int EqDefaultProfileGet(char *out, size_t size)
{
    char enabled[16];
    if (TLIBCFileGetKeyValue(ConfPath().c_str(), kKeyEqEnable, enabled, sizeof(enabled), 0) < 1 ||
        strcmp(enabled, "yes") != 0)
        return 0;
    char name[256];
    if (TLIBCFileGetKeyValue(ConfPath().c_str(), kKeyEqDefault, name, sizeof(name), 0) < 1)
        return 0;
    std::string systemFile = TarnPath(TARN_EQ_SYSTEM_FILE);
    int found = EqProfileLookup(systemFile.c_str(), name, out, size);
    if (found < 0) {
        TarnLog("%s:%d Failed to open the system EQ profile [%s].", kEqLogUnit, 586, systemFile.c_str());
        return found;
    }
    if (found == 0)
        return EqProfileLookup(TarnPath(TARN_EQ_USER_FILE).c_str(), name, out, size);
    return found;
}

int AudioIsSupportedFile(int mode, const char *path)
{
    if (mode == 0)
        return 1;
    if (!path)
        return 0;
    // Streams are always accepted.
    if (strncmp(path, "http", 4) == 0)
        return 1;
    const char *dot = strrchr(path, '.');
    if (!dot)
        return 0;
    const char *ext = dot + 1;
    if (mode == 2) {
        for (const char *candidate : kShortList) {
            if (strcasecmp(ext, candidate) == 0)
                return 1;
        }
        return 0;
    }
    for (const char *candidate : kFullList) {
        if (strcasecmp(ext, candidate) == 0)
            return 1;
    }
    return 0;
}

int MixerFindDevice(char *mixerPath, size_t mixerSize, char *dspPath, size_t dspSize)
{
    // The highest-numbered mixer is preferred.
    for (int device = TARN_MIXER_MAX_DEVICE; device >= 0; --device) {
        std::string path = DevicePath(TARN_MIXER_BASE, device);
        int fd = g_ops.open(path.c_str(), O_RDONLY);
        if (fd < 0)
            continue;
        g_ops.close(fd);
        if (mixerPath && mixerSize > 0)
            snprintf(mixerPath, mixerSize, "%s", path.c_str());
        if (dspPath && dspSize > 0)
            snprintf(dspPath, dspSize, "%s", DevicePath(TARN_DSP_BASE, device).c_str());
        return device;
    }
    return -1;
}

int MixerGetVolume()
{
    char path[256];
    if (MixerFindDevice(path, sizeof(path), nullptr, 0) < 0)
        return -1;
    int fd = g_ops.open(path, O_RDONLY);
    if (fd < 0)
        return -1;
    int result = -1;
    int mask = 0;
    if (g_ops.ioctl(fd, SOUND_MIXER_READ_DEVMASK, &mask) >= 0) {
        int channel = ChooseChannel(mask);
        if (channel < 0) {
            // A mixer without channels reads as silent rather than failing.
            result = 0;
        } else {
            int level = 0;
            if (g_ops.ioctl(fd, MIXER_READ(channel), &level) >= 0) {
                int left = level & 0xff;
                int right = (level >> 8) & 0xff;
                result = (left + right) / 2;
                if (result > 100)
                    result = 100;
            }
        }
    }
    g_ops.close(fd);
    return result;
}

int MixerSetVolume(int device, int volume)
{
    if (device < 0 || device > TARN_MIXER_MAX_DEVICE)
        return -1;
    volume = Clamp(volume);
    std::string path = DevicePath(TARN_MIXER_BASE, device);
    int fd = g_ops.open(path.c_str(), O_RDONLY);
    if (fd < 0)
        return -1;
    int result = -1;
    int mask = 0;
    if (g_ops.ioctl(fd, SOUND_MIXER_READ_DEVMASK, &mask) >= 0) {
        int channel = ChooseChannel(mask);
        if (channel >= 0) {
            int level = volume * 256 + volume;
            if (g_ops.ioctl(fd, MIXER_WRITE(channel), &level) >= 0)
                result = 0;
        }
    }
    g_ops.close(fd);
    return result;
}

int MixerSetVolumeAll(int volume)
{
    int result = -1;
    for (int device = TARN_MIXER_MAX_DEVICE; device >= 0; --device) {
        if (MixerSetVolume(device, volume) == 0)
            result = 0;
    }
    return result;
}

int VolumeConfGet()
{
    char value[8];
    if (TLIBCFileGetKeyValue(ConfPath().c_str(), kKeyVolume, value, sizeof(value), 0) < 1)
        return -1;
    return static_cast<int>(strtol(value, nullptr, 10));
}

int VolumeConfSet(int volume)
{
    char value[16];
    snprintf(value, sizeof(value), "%d", Clamp(volume));
    if (TLIBCFileSetKeyValue(ConfPath().c_str(), kKeyVolume, value, kVolumeLineFormat) == -1)
        return -1;
    return 0;
}

int VolumeApplySaved()
{
    int volume = VolumeConfGet();
    if (volume == -1)
        return -1;
    return MixerSetVolumeAll(volume) == 0 ? 0 : -1;
}

int VolumeSyncFromProc()
{
    FILE *fp = fopen(TarnPath(TARN_PROC_VOLUME).c_str(), "r");
    if (!fp)
        return -1;
    char line[8];
    if (!fgets(line, sizeof(line), fp)) {
        fclose(fp);
        return -1;
    }
    fclose(fp);
    int volume = static_cast<int>(strtol(line, nullptr, 10));
    return VolumeConfSet(volume) == -1 ? -1 : 0;
}
