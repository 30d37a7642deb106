#include "platform/http_fetch.h"

#include <curl/curl.h>

namespace {

struct Sink {
    std::string *body;
    size_t maxBytes;
    bool tooLarge;
};

size_t WriteBody(char *data, size_t size, size_t count, void *user)
{
    Sink *sink = static_cast<Sink *>(user);
    size_t n = size * count;
    if (sink->body->size() + n > sink->maxBytes) {
        sink->tooLarge = true;
        return 0;  // makes libcurl stop with CURLE_WRITE_ERROR
    }
    sink->body->append(data, n);
    return n;
}

int CheckAbort(void *user, curl_off_t, curl_off_t, curl_off_t, curl_off_t)
{
    return static_cast<const std::atomic<bool> *>(user)->load() ? 1 : 0;
}

HttpFetchError ErrorOf(CURLcode rc, bool tooLarge)
{
    if (tooLarge || rc == CURLE_FILESIZE_EXCEEDED)
        return HTTP_FETCH_TOO_LARGE;
    switch (rc) {
    case CURLE_COULDNT_CONNECT:
        return HTTP_FETCH_CONNECT;
    case CURLE_ABORTED_BY_CALLBACK:
        return HTTP_FETCH_ABORTED;
    case CURLE_OPERATION_TIMEDOUT:
        return HTTP_FETCH_TIMEOUT;
    case CURLE_URL_MALFORMAT:
    case CURLE_COULDNT_RESOLVE_HOST:
    case CURLE_UNSUPPORTED_PROTOCOL:
        return HTTP_FETCH_BAD_URL;
    default:
        return HTTP_FETCH_FAILED;
    }
}

}  // namespace

int HttpFetch(const std::string &url, const HttpFetchOptions &options, std::string *body,
              HttpFetchResult *result)
{
    body->clear();
    *result = HttpFetchResult();
    CURL *curl = curl_easy_init();
    if (curl == nullptr) {
        result->error = HTTP_FETCH_NO_HANDLE;
        result->message = "no transfer handle";
        return -1;
    }
    Sink sink = {body, options.maxBytes, false};
    char error[CURL_ERROR_SIZE] = "";
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(curl, CURLOPT_CONNECTTIMEOUT, options.connectTimeoutSeconds);
    curl_easy_setopt(curl, CURLOPT_TIMEOUT, options.timeoutSeconds);
    curl_easy_setopt(curl, CURLOPT_PROTOCOLS_STR, options.protocols);
    if (options.maxRedirects > 0) {
        curl_easy_setopt(curl, CURLOPT_FOLLOWLOCATION, 1L);
        curl_easy_setopt(curl, CURLOPT_MAXREDIRS, options.maxRedirects);
        curl_easy_setopt(curl, CURLOPT_REDIR_PROTOCOLS_STR, options.protocols);
    } else {
        curl_easy_setopt(curl, CURLOPT_FOLLOWLOCATION, 0L);
    }
    if (options.noProxy)
        curl_easy_setopt(curl, CURLOPT_PROXY, "");
    curl_easy_setopt(curl, CURLOPT_MAXFILESIZE, static_cast<long>(options.maxBytes));
    if (options.userAgent != nullptr)
        curl_easy_setopt(curl, CURLOPT_USERAGENT, options.userAgent);
    if (options.anyEncoding)
        curl_easy_setopt(curl, CURLOPT_ACCEPT_ENCODING, "");
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, WriteBody);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &sink);
    curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, error);
    if (options.abort != nullptr) {
        curl_easy_setopt(curl, CURLOPT_XFERINFOFUNCTION, CheckAbort);
        curl_easy_setopt(curl, CURLOPT_XFERINFODATA, const_cast<std::atomic<bool> *>(options.abort));
        curl_easy_setopt(curl, CURLOPT_NOPROGRESS, 0L);
    }

    CURLcode rc = curl_easy_perform(curl);
    curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &result->status);
    curl_easy_cleanup(curl);

    if (rc != CURLE_OK || sink.tooLarge) {
        result->error = ErrorOf(rc, sink.tooLarge);
        result->message = error[0] ? error : curl_easy_strerror(rc);
        body->clear();
        return -1;
    }
    return 0;
}
