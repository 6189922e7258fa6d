// The two network legs of the session's handshake, supplied by its delegate. Each method calls
// its completion exactly once, on any thread: with data and no error, or with an error.
#pragma once

#include <functional>
#include <optional>

#include "platform/data.h"
#include "platform/error.h"

class TarvexSAPSession;

using TarvexSAPDataCompletion = std::function<void(std::optional<platform::Data>, std::optional<platform::Error>)>;

class TarvexSAPSessionDelegate {
 public:
  virtual ~TarvexSAPSessionDelegate() = default;
  // The server's setup certificate, exactly as served.
  virtual void sessionRequestCertificateWithCompletionHandler(TarvexSAPSession& session,
                                                              TarvexSAPDataCompletion completion) = 0;
  // Posts the handshake request and answers with the server's session info.
  virtual void sessionRequestHandshakeWithServerCompletionHandler(TarvexSAPSession& session,
                                                                  const std::optional<platform::Data>& handshakeData,
                                                                  TarvexSAPDataCompletion completion) = 0;
};
