// How the server answers a request: the device endpoints through DeviceServices with the faults
// set on them applied, and the admin interface.
#include <openssl/rand.h>

#include <nlohmann/json.hpp>

#include "devserver/dev_server_impl.h"
#include "devserver/strict_base64.h"

namespace devserver {

using nlohmann::json;

namespace {

std::optional<std::string> header(const httplib::Request& req, const char* name) {
  if (!req.has_header(name)) {
    return std::nullopt;
  }
  return req.get_header_value(name);
}

void setJSON(httplib::Response& res, int status, const json& value) {
  res.status = status;
  res.set_content(value.dump(-1, ' ', false, json::error_handler_t::replace), "application/json");
}

// The faults that rewrite an answer: the handshake's members (only of a successful handshake,
// the one answer that has them), then the status and the body.
void applyFault(Endpoint endpoint, const Fault& fault, Answer& answer) {
  if (endpoint == Endpoint::sapSession && answer.status == 200 && (fault.sessionValidity || fault.sessionInfo)) {
    json document = json::parse(answer.body, nullptr, false);  // ours: always an object
    if (fault.sessionValidity) {
      document["session-validity"] = *fault.sessionValidity;
    }
    if (fault.sessionInfo) {
      document["session-info"] = *fault.sessionInfo;
    }
    answer.body = document.dump(-1, ' ', false, json::error_handler_t::replace);
  }
  if (fault.status) {
    answer.status = *fault.status;
  }
  if (fault.body) {
    answer.body = *fault.body;
  }
}

// The right seq with a wrong MAC, or, where there was no signature to spoil, a random one.
void corruptSignature(std::optional<std::array<uint8_t, 40>>& signature) {
  if (signature) {
    (*signature)[39] ^= 0x01;
    return;
  }
  signature.emplace();
  (*signature)[7] = 1;
  RAND_bytes(signature->data() + 8, 32);
}

}  // namespace

void setAnswer(httplib::Response& res, const Answer& answer) {
  res.status = answer.status;
  if (answer.status == 204 || answer.status == 304) {
    return;  // these carry no body on the wire
  }
  res.set_content(answer.body, answer.contentType);  // also when empty: the error handler keeps out
}

void DevServer::Impl::dispatch(const httplib::Request& req, httplib::Response& res) {
  const bool admin = options.admin && isAdminPath(req.path);
  // Our own failures are answers; what a library throws (JSON, allocation) ends here, counted.
  try {
    if (admin) {
      dispatchAdmin(req, res);
    } else {
      dispatchDevice(req, res);
    }
  } catch (const std::exception& error) {
    setAnswer(res, errorAnswer(500, std::string("internal error: ") + error.what()));
    if (!admin) {
      stats.countStatus(500);
    }
  }
}

void DevServer::Impl::dispatchDevice(const httplib::Request& req, httplib::Response& res) {
  const auto endpoint = endpointAtPath(req.path);
  if (!endpoint) {
    setAnswer(res, errorAnswer(404, "no such endpoint"));
    stats.countStatus(404);
    return;
  }
  stats.countRequest(*endpoint);
  const std::string_view method = endpointMethod(*endpoint);
  if (req.method != method && !(method == "GET" && req.method == "HEAD")) {
    setAnswer(res, errorAnswer(405, "method not allowed: use " + std::string(method)));
    res.set_header("Allow", method == "GET" ? "GET, HEAD" : "POST");
    stats.countStatus(405);
    return;
  }
  switch (*endpoint) {
    case Endpoint::setupCertificate:
      respond(*endpoint, req, res, services->setupCertificate());
      return;
    case Endpoint::sapSession:
      respond(*endpoint, req, res, services->sapSession(req.body));
      return;
    default:
      respond(*endpoint, req, res,
              services->tokenRequest(
                  *endpoint, SignedRequest{header(req, "session-identifier"), header(req, "signature"), req.body}));
      return;
  }
}

// Faults act on the finished answer, so a verified request's seq is known for signing.
void DevServer::Impl::respond(Endpoint endpoint, const httplib::Request& req, httplib::Response& res, Answer answer) {
  const std::optional<Fault> fault = faults.take(endpoint);
  if (fault && ((fault->delay.count() > 0 && !pause(fault->delay)) || fault->drop)) {
    ConnectionTracker::cut(req.ssl);
    tlRequest.dropped = true;
    return;
  }
  if (fault) {
    applyFault(endpoint, *fault, answer);
  }
  if (answer.status == 204 || answer.status == 304) {
    answer.body.clear();  // what is signed must be what is sent
  }
  if (isTokenEndpoint(endpoint)) {
    signAnswer(answer, fault && fault->signature ? *fault->signature : SignatureFault::valid, res);
  }
  setAnswer(res, answer);
  stats.countStatus(answer.status);
}

void DevServer::Impl::signAnswer(const Answer& answer, SignatureFault mode, httplib::Response& res) {
  std::optional<std::array<uint8_t, 40>> signature;
  if (mode != SignatureFault::missing) {
    signature = services->sign(answer, answer.body);
  }
  if (mode == SignatureFault::corrupt) {
    corruptSignature(signature);
  }
  if (!signature) {
    return;
  }
  const std::string text = base64Encode(*signature);
  res.set_header("signature", mode == SignatureFault::padded ? " \t " + text + " \t" : text);
}

bool DevServer::Impl::pause(std::chrono::milliseconds delay) {
  std::unique_lock lock(stopMutex);
  return !stopWake.wait_for(lock, delay, [this] { return stopping; });
}

void DevServer::Impl::dispatchAdmin(const httplib::Request& req, httplib::Response& res) {
  const auto methodNotAllowed = [&res](const char* allowed) {
    setJSON(res, 405, json{{"error", std::string("method not allowed: use ") + allowed}});
    res.set_header("Allow", allowed);
  };
  if (req.path == "/_admin/faults") {
    if (req.method == "GET") {
      setJSON(res, 200, json{{"faults", faults.toJSON()}});
    } else if (req.method == "POST") {
      const json document = json::parse(req.body, nullptr, false);
      if (document.is_discarded()) {
        setJSON(res, 400, json{{"error", "body is not JSON"}});
        return;
      }
      platform::Result<FaultRule> rule = parseFaultRule(document);
      if (!rule) {
        setJSON(res, 400, json{{"error", rule.error()}});
        return;
      }
      faults.set(*std::move(rule));
      setJSON(res, 200, json{{"faults", faults.toJSON()}});
    } else if (req.method == "DELETE") {
      faults.clear();
      setJSON(res, 200, json{{"faults", json::array()}});
    } else {
      methodNotAllowed("GET, POST, DELETE");
    }
  } else if (req.path == "/_admin/stats") {
    if (req.method == "GET") {
      setJSON(res, 200, stats.toJSON());
    } else {
      methodNotAllowed("GET");
    }
  } else if (req.path == "/_admin/reset") {
    if (req.method == "POST") {
      faults.clear();
      stats.reset();
      setJSON(res, 200, json{{"faults", json::array()}, {"stats", stats.toJSON()}});
    } else {
      methodNotAllowed("POST");
    }
  } else {
    setJSON(res, 404, json{{"error", "no such admin endpoint"}});
  }
}

}  // namespace devserver
