// The one resend a request may get: on a fresh connection, when the reused connection it went out
// on had already been closed by the server and no byte of an answer arrived, so the server never
// saw it.
#include <cstdio>

#include "platform/http/http_transfer.h"

namespace platform {

// libcurl rewinds a body only to send the request again on a fresh connection, when the reused one
// it went out on turned out dead before any byte of an answer arrived; once at most, counting
// the sends that `shouldResend` makes.
int rewindForResend(void* user, curl_off_t offset, int origin) {
  auto* task = static_cast<HTTPTaskState*>(user);
  if (offset != 0 || origin != SEEK_SET || task->resent) return CURL_SEEKFUNC_CANTSEEK;
  task->resent = true;
  task->uploaded = 0;
  return CURL_SEEKFUNC_OK;
}

// A reused connection that the server had closed fails the send itself, or ends before any
// answer: the server never saw the request, which may go out once more on a fresh connection.
bool shouldResend(const HTTPTaskState& t, CURLcode result) {
  if (t.resent || (result != CURLE_SEND_ERROR && result != CURLE_RECV_ERROR && result != CURLE_GOT_NOTHING))
    return false;
  long connects = -1, headerBytes = -1;
  curl_easy_getinfo(t.easy.get(), CURLINFO_NUM_CONNECTS, &connects);
  curl_easy_getinfo(t.easy.get(), CURLINFO_HEADER_SIZE, &headerBytes);
  return connects == 0 && headerBytes == 0 && t.received.empty();
}

}  // namespace platform
