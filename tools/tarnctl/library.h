// What tarnctl adds to the queue: song records for files, folders, M3U
// playlists and URLs, filled from the media library when it knows the song
// and from the file's own tags otherwise; searching and browsing the
// library; the playlist folder where "save" writes the queue.
#ifndef TARNCTL_LIBRARY_H
#define TARNCTL_LIBRARY_H

#include <memory>
#include <string>
#include <vector>

#include "daemon/tarn_types.h"
#include "platform/medialib.h"

// The media library opened for reading, on first use. Null (with the
// reason in *why) when there is none or it cannot be read.
MediaLib *LibraryOpen(std::string *why);

// True for texts that name a stream (scheme://..., other than file://).
bool IsUrl(const std::string &text);

// Records for the arguments of "add", in order: a file (its record), a
// folder (every playable song below it, in path order), an M3U/M3U8 file
// (its entries), a URL (as it is). Arguments that give nothing are listed
// in *problems ("ARG: reason"); *warnings gets entries of playlists that
// are skipped. Records are heap-allocated one by one (7336 bytes each).
void SongsForArgs(const std::vector<std::string> &args,
                  std::vector<std::unique_ptr<TARN_MEDIA_INFO>> *songs,
                  std::vector<std::string> *problems, std::vector<std::string> *warnings);

// The record of one file: 0, or -1 with the reason.
int SongForFile(const std::string &path, TARN_MEDIA_INFO *info, std::string *why);

// Songs of the library whose field (any, artist, album, title) holds every
// word (case-insensitive), in library order. 0, or -1 with the reason.
int LibrarySearch(const std::string &field, const std::vector<std::string> &words,
                  std::vector<MediaSong> *songs, std::string *why);

// The folder every song of the library lies below ("" for an empty one).
std::string LibraryRoot(const std::vector<MediaSong> &all);

// Where "save" writes playlists: "audio_playlist_dir" of the configuration
// file, else the folder "playlists" in the library's root. "" with *why
// when neither can be found.
std::string PlaylistFolder(std::string *why);

// One playlist "load" can find: a saved playlist of the library, or an
// M3U file in the playlist folder.
struct NamedPlaylist {
    std::string name, path;
};
std::vector<NamedPlaylist> AllPlaylists(std::string *why);

#endif
