#include "platform/media_id.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <openssl/rand.h>

#include <cstdio>
#include <cstring>
#include <mutex>
#include <string>

#include "platform/tarn_env.h"
#include "platform/tarn_log.h"

static const char kLogUnit[] = "media_id";

namespace {

const int kKeyLen = 16;
const int kBlockLen = 16;
// The bytes after the id in the plain block. A decoded block must carry
// them, which is how an altered or made-up token is recognised.
const unsigned char kPad[kBlockLen - 4] = {'t', 'a', 'r', 'n', 's', 'o', 'n', 'g', 0x5a, 0xa5, 0x0f, 0xf0};

std::mutex g_keyMutex;

std::string KeyFile()
{
    return TarnPath("/usr/tarn/etc/media_id.key");
}

int ReadKey(const std::string &path, unsigned char *key)
{
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0)
        return -1;
    ssize_t n = read(fd, key, kKeyLen);
    close(fd);
    return n == kKeyLen ? 0 : -2;
}

int MakeDirs(const std::string &dir)
{
    std::string part;
    for (size_t i = 1; i <= dir.size(); ++i) {
        if (i == dir.size() || dir[i] == '/') {
            part = dir.substr(0, i);
            if (mkdir(part.c_str(), 0755) != 0 && errno != EEXIST)
                return -1;
        }
    }
    return 0;
}

// Creates the secret: written to a private temporary file, then linked to
// its name, so that two processes starting at once end up with one secret.
int CreateKey(const std::string &path)
{
    std::string dir = path.substr(0, path.rfind('/'));
    if (MakeDirs(dir) != 0) {
        TLOG("Failed to create %s, %m", dir.c_str());
        return -1;
    }
    unsigned char key[kKeyLen];
    if (RAND_bytes(key, kKeyLen) != 1) {
        TLOG("Failed to get random bytes for the song id secret");
        return -1;
    }
    std::string tmp = path + ".XXXXXX";
    std::string buf = tmp;
    int fd = mkstemp(&buf[0]);
    if (fd < 0) {
        TLOG("Failed to create %s, %m", tmp.c_str());
        return -1;
    }
    fchmod(fd, 0600);
    bool ok = write(fd, key, kKeyLen) == kKeyLen && fsync(fd) == 0;
    close(fd);
    if (ok && link(buf.c_str(), path.c_str()) != 0 && errno != EEXIST) {
        TLOG("Failed to create %s, %m", path.c_str());
        ok = false;
    }
    unlink(buf.c_str());
    return ok ? 0 : -1;
}

// Reads the secret, creating it on first use. It is read each time (16
// bytes) so that every process follows the file, whoever created it.
int GetKey(unsigned char *key)
{
    std::lock_guard<std::mutex> lock(g_keyMutex);
    std::string path = KeyFile();
    int r = ReadKey(path, key);
    if (r == -1 && errno == ENOENT) {
        if (CreateKey(path) != 0)
            return -1;
        r = ReadKey(path, key);
    }
    if (r != 0) {
        TLOG("Failed to read the song id secret %s (remove it to have a new one made)",
             path.c_str());
        return -1;
    }
    return 0;
}

int Crypt(bool encrypt, const unsigned char *key, const unsigned char *in, unsigned char *out)
{
    EVP_CIPHER_CTX *ctx = EVP_CIPHER_CTX_new();
    if (!ctx)
        return -1;
    int len = 0;
    int ok = EVP_CipherInit_ex(ctx, EVP_aes_128_ecb(), nullptr, key, nullptr, encrypt ? 1 : 0) == 1 &&
             EVP_CIPHER_CTX_set_padding(ctx, 0) == 1 &&
             EVP_CipherUpdate(ctx, out, &len, in, kBlockLen) == 1 && len == kBlockLen;
    EVP_CIPHER_CTX_free(ctx);
    return ok ? 0 : -1;
}

int HexValue(char c)
{
    if (c >= '0' && c <= '9')
        return c - '0';
    if (c >= 'a' && c <= 'f')
        return c - 'a' + 10;
    if (c >= 'A' && c <= 'F')
        return c - 'A' + 10;
    return -1;
}

// The hex text of the first half of HMAC-SHA256(key, path).
std::string PathMac(const unsigned char *key, const std::string &path)
{
    unsigned char mac[EVP_MAX_MD_SIZE];
    unsigned int len = 0;
    if (!HMAC(EVP_sha256(), key, kKeyLen, reinterpret_cast<const unsigned char *>(path.data()),
              path.size(), mac, &len) ||
        len < MEDIA_PATH_MAC_LEN / 2)
        return std::string();
    char hex[MEDIA_PATH_MAC_LEN + 1];
    for (int i = 0; i < MEDIA_PATH_MAC_LEN / 2; ++i)
        snprintf(hex + 2 * i, 3, "%02x", mac[i]);
    return std::string(hex, MEDIA_PATH_MAC_LEN);
}

}  // namespace

std::string MediaPathToken(const std::string &path)
{
    if (path.empty())
        return std::string();
    unsigned char key[kKeyLen];
    if (GetKey(key) != 0)
        return std::string();
    std::string mac = PathMac(key, path);
    if (mac.empty()) {
        TLOG("Failed to sign path [%s]", path.c_str());
        return std::string();
    }
    std::string token;
    token.reserve(path.size() * 2 + 1 + mac.size());
    char hex[3];
    for (unsigned char c : path) {
        snprintf(hex, sizeof(hex), "%02x", c);
        token += hex;
    }
    return token + "-" + mac;
}

int MediaPathTokenDecode(const char *token, std::string *path)
{
    if (!token || !path)
        return -1;
    const char *dash = strchr(token, '-');
    if (!dash || dash == token || (dash - token) % 2 != 0 || strlen(dash + 1) != MEDIA_PATH_MAC_LEN)
        return -1;
    std::string decoded;
    for (const char *p = token; p < dash; p += 2) {
        int hi = HexValue(p[0]), lo = HexValue(p[1]);
        if (hi < 0 || lo < 0 || (hi == 0 && lo == 0))
            return -1;
        decoded += static_cast<char>(hi << 4 | lo);
    }
    std::string given(dash + 1);
    for (char &c : given) {
        if (HexValue(c) < 0)
            return -1;
        if (c >= 'A' && c <= 'F')
            c = static_cast<char>(c - 'A' + 'a');
    }
    unsigned char key[kKeyLen];
    if (GetKey(key) != 0)
        return -1;
    std::string mac = PathMac(key, decoded);
    if (mac.size() != given.size() || CRYPTO_memcmp(mac.data(), given.data(), mac.size()) != 0)
        return -1;
    *path = decoded;
    return 0;
}

int MediaIDEncryption(uint32_t id, char *out, size_t size)
{
    if (!out || size < MEDIA_ID_TOKEN_LEN + 1) {
        TLOG("Bad parameter");
        return -1;
    }
    out[0] = '\0';
    unsigned char key[kKeyLen];
    if (GetKey(key) != 0)
        return -1;
    unsigned char plain[kBlockLen];
    unsigned char cipher[kBlockLen];
    plain[0] = static_cast<unsigned char>(id >> 24);
    plain[1] = static_cast<unsigned char>(id >> 16);
    plain[2] = static_cast<unsigned char>(id >> 8);
    plain[3] = static_cast<unsigned char>(id);
    memcpy(plain + 4, kPad, sizeof(kPad));
    if (Crypt(true, key, plain, cipher) != 0) {
        TLOG("Failed to encrypt song id %u", id);
        return -1;
    }
    for (int i = 0; i < kBlockLen; ++i)
        snprintf(out + 2 * i, 3, "%02x", cipher[i]);
    return 0;
}

std::string MediaIDEncryption(uint32_t id)
{
    char token[MEDIA_ID_TOKEN_LEN + 1];
    if (MediaIDEncryption(id, token, sizeof(token)) != 0)
        return std::string();
    return std::string(token);
}

int MediaIDDecryption(const char *token, uint32_t *id)
{
    if (!token || !id || strlen(token) != MEDIA_ID_TOKEN_LEN)
        return -1;
    unsigned char cipher[kBlockLen];
    for (int i = 0; i < kBlockLen; ++i) {
        int hi = HexValue(token[2 * i]);
        int lo = HexValue(token[2 * i + 1]);
        if (hi < 0 || lo < 0)
            return -1;
        cipher[i] = static_cast<unsigned char>(hi << 4 | lo);
    }
    unsigned char key[kKeyLen];
    if (GetKey(key) != 0)
        return -1;
    unsigned char plain[kBlockLen];
    if (Crypt(false, key, cipher, plain) != 0)
        return -1;
    if (memcmp(plain + 4, kPad, sizeof(kPad)) != 0)
        return -1;
    *id = static_cast<uint32_t>(plain[0]) << 24 | static_cast<uint32_t>(plain[1]) << 16 |
          static_cast<uint32_t>(plain[2]) << 8 | plain[3];
    return 0;
}
