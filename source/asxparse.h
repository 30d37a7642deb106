// Station files in ASX form: the seed lists shipped with the appliance.
//
// The reader is line oriented: it knows "<Entry>", "</Entry>", "<TITLE>" and
// "<Ref href" at the start of a (trimmed) line and ignores everything else.
// Its result has the layout of the radio station list files:
//   {"stations": [{"name": title, "url": ref, "desc": ""}, ...], "total": n}
#ifndef TARN_ASXPARSE_H
#define TARN_ASXPARSE_H

#include <json/json.h>

// Seed files, by radio list type (1 user-defined, 2 favourite).
#define TARN_ASX_MANUAL "/usr/tarn/etc/audio/manual_radio_station.asx"
#define TARN_ASX_DEFAULT "/usr/tarn/etc/audio/default_radio_station.asx"

// Reads the ASX file at path into list["stations"] and list["total"].
// 0 on success; -1 when the path is null or empty, the file cannot be opened
// or reading it fails (the list is then left as it was).
int AsxParse(const char *path, Json::Value &list);

// Reads the seed file of list type 1 or 2. 0 on success, non-zero when the
// parse failed, -1 for any other type.
int AsxImportDefault(int type, Json::Value &list);

#endif
