#include "framework/request_decoder.h"

#include <new>

namespace Ipc {

DecodedRequest decodeRequest(const std::shared_ptr<unsigned char>& body, std::uint32_t size,
                             const CmdFactory& factory) {
  DecodedRequest r;
  r.tag = body.get()[0];
  r.kind = body.get()[1];
  if (r.kind != static_cast<std::uint8_t>(wire::FrameKind::Request)) {
    r.outcome = DecodedRequest::Outcome::NotARequest;
    return r;
  }

  try {
    if (factory) r.cmd = factory(r.tag);
  } catch (const std::bad_alloc&) {
    throw;
  } catch (const std::exception& e) {
    r.outcome = DecodedRequest::Outcome::FactoryFailed;
    r.problem = e.what();
    return r;
  } catch (...) {
    r.outcome = DecodedRequest::Outcome::FactoryFailed;
    r.problem = "unknown exception";
    return r;
  }
  if (!r.cmd) {
    r.outcome = DecodedRequest::Outcome::UnknownTag;
    return r;
  }

  try {
    wire::Reader in(std::shared_ptr<unsigned char>(body, body.get() + 2), size - 2);
    r.cmd->readRequest(in);
    in.expectEnd();
  } catch (const std::bad_alloc&) {
    throw;
  } catch (const std::exception& e) {
    r.outcome = DecodedRequest::Outcome::Malformed;
    r.problem = e.what();
    return r;
  } catch (...) {
    r.outcome = DecodedRequest::Outcome::Malformed;
    r.problem = "unknown exception";
    return r;
  }
  r.outcome = DecodedRequest::Outcome::Command;
  return r;
}

std::optional<std::string> finishRequest(CmdI& cmd) {
  try {
    cmd.finishRequest();
  } catch (const std::bad_alloc&) {
    throw;
  } catch (const std::exception& e) {
    return std::string(e.what());
  } catch (...) {
    return std::string("unknown exception");
  }
  return std::nullopt;
}

}  // namespace Ipc
