// Radio directory updaters: fetch a station list from the radio directory
// named in /etc/tarninfo.conf and store it as a radio list file.
//
// Configuration keys of /etc/tarninfo.conf:
//   radio_directory_url      base URL of a radio-browser style directory
//                            (GET <base>/json/stations/... answering a JSON
//                            array of {"name", "url"/"url_resolved",
//                            "bitrate", "tags", ...})
//   radio_directory_limit    stations asked for per list (default 100)
//   radio_directory_timeout  seconds a fetch may take in all (default 20;
//                            the daemon waits meanwhile)
// Without a URL, or when the fetch fails, no file is written (a stale file
// is left as it was, a missing one stays missing).
#ifndef TARN_RADIO_FETCH_H
#define TARN_RADIO_FETCH_H

#include <string>

#include <json/json.h>

namespace MediaServer {

// Writes a fresh /usr/tarn/etc/audio/radio/radioio.json from the directory's
// most played stations. 0 on success, -1 on failure.
int RadioUpdateRadioio();

// name is "shoutcast_" + a genre's display text. Writes a fresh
// /usr/tarn/etc/audio/radio/<name>.json from the directory's stations tagged
// with the genre. 0 on success, -1 on failure.
int RadioUpdateShoutcastByGenre(const std::string &name);

}  // namespace MediaServer

// Helpers of the updaters, exposed for their tests.
// Fetches url into body: connect time at most 5 s, total time at most the
// configured time-out (or timeoutSeconds), body at most 4 MiB. 0 / -1.
int RadioDirectoryFetch(const std::string &url, std::string &body);
int RadioDirectoryFetch(const std::string &url, std::string &body, long timeoutSeconds);
// Turns a directory answer (JSON array of station objects) into a list in
// the radio list file layout ("bitrate" as kilobits per second text).
// 0 / -1 when the text is not such an array.
int RadioDirectoryToList(const std::string &body, Json::Value &list);

#endif
