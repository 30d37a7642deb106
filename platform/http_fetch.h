// One bounded HTTP download: a GET whose body, time and redirects are
// limited, for callers that must not wait long or take in much.
#ifndef TARN_HTTP_FETCH_H
#define TARN_HTTP_FETCH_H

#include <atomic>
#include <cstddef>
#include <string>

struct HttpFetchOptions {
    size_t maxBytes = 0;              // largest body taken; a longer one fails
    long connectTimeoutSeconds = 5;   // longest wait for the connection
    long timeoutSeconds = 10;         // longest time of the whole transfer
    const char *userAgent = nullptr;  // User-Agent header; none when null
    const char *protocols = "http";   // libcurl protocol list ("http,https")
    long maxRedirects = 0;            // redirects followed (0: none followed)
    bool noProxy = false;             // ignore proxies named in the environment
    bool anyEncoding = false;         // offer every content encoding libcurl decodes
    // When set, the transfer gives up as soon as it reads true.
    const std::atomic<bool> *abort = nullptr;
};

// Why a download did not complete.
enum HttpFetchError {
    HTTP_FETCH_OK = 0,        // the transfer completed (whatever the status)
    HTTP_FETCH_NO_HANDLE,     // no transfer could be started
    HTTP_FETCH_TOO_LARGE,     // the body is over maxBytes
    HTTP_FETCH_CONNECT,       // the connection was refused or failed
    HTTP_FETCH_ABORTED,       // *abort became true
    HTTP_FETCH_TIMEOUT,       // a time limit ran out
    HTTP_FETCH_BAD_URL,       // malformed URL, unknown host or protocol refused
    HTTP_FETCH_FAILED,        // any other transfer failure
};

struct HttpFetchResult {
    HttpFetchError error = HTTP_FETCH_OK;
    long status = 0;      // HTTP status of the answer, 0 when there was none
    std::string message;  // what went wrong, in libcurl's words ("" when OK)
};

// GETs url into *body. 0 when the transfer completed (result->status holds
// the HTTP status, which the caller judges); -1 when it did not, with
// result->error saying why and *body emptied. Logs nothing.
int HttpFetch(const std::string &url, const HttpFetchOptions &options, std::string *body,
              HttpFetchResult *result);

#endif
