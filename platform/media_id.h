// Song-id tokens for the song URLs handed to renderers.
//
// A token is the hex text of one AES-128 block holding the song id and a
// fixed pad, encrypted with a secret of this installation. It cannot be
// guessed from the id, and a token that was altered or made up does not
// decode. The secret is 16 random bytes created on first use in
// /usr/tarn/etc/media_id.key (mode 0600); the daemon and the song server
// share it through that file.
#ifndef TARN_MEDIA_ID_H
#define TARN_MEDIA_ID_H

#include <cstddef>
#include <cstdint>
#include <string>

// Length of a token text (without the terminating NUL).
#define MEDIA_ID_TOKEN_LEN 32

// Writes the token of song id into out (at least MEDIA_ID_TOKEN_LEN + 1
// bytes). 0, or -1 (logged) when the secret cannot be read or created.
int MediaIDEncryption(uint32_t id, char *out, size_t size);

// The same as a string; empty on failure.
std::string MediaIDEncryption(uint32_t id);

// Decodes a token (exactly MEDIA_ID_TOKEN_LEN hex digits, either case) into
// *id. 0, or -1 for a malformed, altered or foreign token (not logged: the
// caller decides) or when the secret cannot be read.
int MediaIDDecryption(const char *token, uint32_t *id);

// Path tokens, for songs without a library id and songs on USB volumes: the
// lowercase hex text of the path's bytes, "-", and the first 16 bytes (32 hex
// digits) of HMAC-SHA256 of the path under the same secret. Only a holder of
// the secret can name a file this way.
#define MEDIA_PATH_MAC_LEN 32

// The token of path; empty on failure (logged) or for an empty path.
std::string MediaPathToken(const std::string &path);

// Decodes a path token into *path. 0, or -1 for a malformed, altered or
// foreign token (not logged) or when the secret cannot be read.
int MediaPathTokenDecode(const char *token, std::string *path);

#endif
