// Arbitrary bytes as a handshake request to the server. Whatever is accepted must follow the
// request layout, and the answer must be a version-1 session info.
#include <algorithm>
#include <cstring>

#include "fuzz_tsap_fixture.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  TarvexSAPServer& server = *tsapfuzz::fixture().server;
  const auto answer =
      server.handshake("FUZZ-HANDSHAKE", std::span<const uint8_t>(data, size), std::chrono::seconds(60));
  if (answer.status == TarvexSAPServerStatus::ok) {
    if (size != 90 || std::memcmp(data, "TSAP\x01", 5) != 0 || data[5] > 20 ||
        !std::all_of(data + 6 + data[5], data + 26, [](uint8_t b) { return b == 0; })) {
      tsapfuzz::violated("malformed request accepted");
    }
    if (answer.sessionInfo[0] != 1) {
      tsapfuzz::violated("session info version");
    }
  } else if (answer.status != TarvexSAPServerStatus::malformed) {
    tsapfuzz::violated("unexpected handshake status");
  }
  return 0;
}
