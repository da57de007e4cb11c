#pragma once
// Turns one received frame into a command: the part of the transport that
// reads what a client sent, kept free of sockets so that it can be fuzzed.
// decodeRequest runs on the I/O thread that cut the frame and does the
// cheap part; finishRequest runs on the thread that runs the command and
// does the part that costs in proportion to a large payload.
//
// Thread safety: a pure function of its arguments (and of the factory).
// Failures: never throws for anything a client can send; every problem is
// an outcome. Only std::bad_alloc may escape.

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "framework/svc_stub.h"

namespace Ipc {

// Whether the length field of a frame header is acceptable: the tag and the
// kind at least, kMaxBody at most. Checked before any byte of the body is
// read or anything is allocated for it.
constexpr bool frameLengthValid(std::uint32_t length) noexcept { return length >= 2 && length <= wire::kMaxBody; }

struct DecodedRequest {
  enum class Outcome {
    Command,        // cmd holds the command with its request read (finishRequest to follow)
    UnknownTag,     // the factory knows no command for the tag
    NotARequest,    // the frame's kind is not Request
    FactoryFailed,  // the factory threw (the processor is going away)
    Malformed,      // the payload did not decode as the command's request
  };
  Outcome outcome = Outcome::Malformed;
  std::uint8_t tag = 0;
  std::uint8_t kind = 0;
  std::shared_ptr<CmdI> cmd;  // Command, and Malformed (for its name)
  std::string problem;        // FactoryFailed, Malformed: what went wrong
};

// body holds size bytes: tag, kind, payload. The payload reader shares
// body, so byte strings reach the command without a copy. A payload must be
// consumed exactly.
DecodedRequest decodeRequest(const std::shared_ptr<unsigned char>& body, std::uint32_t size, const CmdFactory& factory);

// The rest of a decoded command's request (CmdI::finishRequest), run where
// the command runs: what went wrong when the request turns out malformed,
// nothing when it is complete. Failures here are the same Malformed
// outcome as those of decodeRequest. Only std::bad_alloc may escape.
std::optional<std::string> finishRequest(CmdI& cmd);

}  // namespace Ipc
