// Owning handles for libcurl's objects: a reader never sees a hand-written cleanup. Each is a
// move-only unique_ptr that releases its object when it goes out of scope; `.get()` borrows,
// `.release()` hands ownership back to C.
#pragma once

#include <curl/curl.h>

#include <memory>

namespace platform {

// libcurl's handle types are all `void` to C++, so each kind gets its own deleter. Each call
// releases the object with libcurl's own function for it.
struct CurlEasyCleanup {
  // Releases an easy handle (curl_easy_cleanup).
  void operator()(CURL* easy) const { curl_easy_cleanup(easy); }
};
struct CurlMultiCleanup {
  // Releases a multi handle (curl_multi_cleanup).
  void operator()(CURLM* multi) const { curl_multi_cleanup(multi); }
};
struct CurlSlistFree {
  // Releases a header list and its copies of the lines (curl_slist_free_all).
  void operator()(curl_slist* list) const { curl_slist_free_all(list); }
};

using CurlEasyPtr = std::unique_ptr<CURL, CurlEasyCleanup>;
using CurlMultiPtr = std::unique_ptr<CURLM, CurlMultiCleanup>;
using CurlSlistPtr = std::unique_ptr<curl_slist, CurlSlistFree>;

// curlSlistAppend appends a copy of `line` to `list`. It returns false, leaving `list` as it was,
// when libcurl cannot allocate the entry.
inline bool curlSlistAppend(CurlSlistPtr& list, const char* line) {
  curl_slist* grown = curl_slist_append(list.get(), line);
  if (!grown) return false;
  (void)list.release();  // the old head is now the grown list's first entry
  list.reset(grown);
  return true;
}

}  // namespace platform
