// File types of the media library: the indexer's extension of a file, the
// MIME type of each playable type, and whether a file lies on a USB volume.
#ifndef TARN_MEDIA_TYPES_H
#define TARN_MEDIA_TYPES_H

#include <cstddef>

// The extension the indexer knows the file by: the text after the last dot
// of the file name, matched without regard to case against the playable
// types ("mp3", "m4a", "ogg", "aac", "wma", "flac", "aiff", "aif", "mp1",
// "mp2", "mpa", "wav", "ac3", "ra", "ram", "m4p", "m4b", "ape"), the other
// types the media library indexes ("oga", "opus", "mpc", "wv") and "txt".
// Returns the lower-case extension (a static text, never freed), or null
// when the path is null, has no extension or one the indexer does not know.
const char *TARNIndexExtGet(const char *path);

// Writes the MIME type of an indexer extension (case-insensitive, e.g.
// "mp3" -> "audio/mpeg", "txt" -> "text/plain") into buffer.
// Returns 0, or -1 for an unknown extension, a null argument or a buffer
// too small for the type (the buffer then holds an empty text when size > 0).
int TARNAudioGetMimetype(const char *ext, char *buffer, size_t size);

// The directory under which USB volumes are mounted: the value of
// "usb_mount_root" in /etc/tarninfo.conf, or TarnPath("/media/usb") when
// the key is missing. Trailing slashes are removed ("/" stays "/").
int TARNAudioUSBMountRoot(char *buffer, size_t size);

// 1 when path lies on a USB volume (it is the mount root or below it,
// compared by path components, without resolving links), 0 when not,
// -1 for a null or empty path.
int TARNAudioIsUSBVolume(const char *path);

#endif
