// Bounded JSON reading. Every JSON text the system reads from a file or from
// the network goes through these functions: the text is limited in size and
// nesting depth, and nothing the parser does can throw past the caller. A
// text over a limit, or one that is not JSON, is a plain failure.
#ifndef TARN_JSON_READ_H
#define TARN_JSON_READ_H

#include <cstddef>
#include <string>

#include <json/json.h>

// Nesting depth that no file or answer of the system comes near.
#define JSON_READ_MAX_DEPTH 64

// Parses text into *out. max_bytes bounds the text's length, max_depth the
// nesting of arrays and objects. Comments are allowed. Returns 0, or -1 with
// a short reason in *err (err may be null); *out is then null.
int JsonParseBounded(const std::string &text, size_t max_bytes, int max_depth,
                     Json::Value *out, std::string *err);

// Reads and parses the file at path under the same limits. A file that is
// missing or cannot be read is a failure with errno's text in *err; a file
// longer than max_bytes is refused without being read whole.
int JsonReadFileBounded(const std::string &path, size_t max_bytes, int max_depth,
                        Json::Value *out, std::string *err);

#endif
