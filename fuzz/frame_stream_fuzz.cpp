// libFuzzer target for what the server reads off a connection: a stream of
// frames. Each frame's length field is checked as the transport checks it,
// then the frame goes through the transport's request decoding with the
// server's command table: kind check, command creation by tag, the
// command's request decoder and the exact-consumption rule, then the rest
// of the request's decoding (finishRequest).
//
// The properties: no crash, no read outside a frame (each body is copied to
// an allocation of exactly its size, so AddressSanitizer sees any overrun),
// and an accepted command is the one its tag names. Decoding stops where
// the server would end the connection.

#include <cstdint>
#include <cstring>
#include <memory>

#include "framework/request_decoder.h"
#include "protocol/cmd_table.h"
#include "protocol/commands.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const Ipc::CmdFactory factory = [](std::uint8_t tag) { return Ipc::DB::makeCommand(tag, nullptr); };
  std::size_t at = 0;
  while (size - at >= wire::kLengthSize) {
    const std::uint32_t length = wire::frameLength(data + at);
    if (!Ipc::frameLengthValid(length)) return 0;
    at += wire::kLengthSize;
    if (size - at < length) return 0;  // the rest has not arrived
    std::shared_ptr<unsigned char> body(ExportedUCharAlloc::alloc(length), ExportedUCharAlloc());
    std::memcpy(body.get(), data + at, length);
    at += length;

    const Ipc::DecodedRequest r = Ipc::decodeRequest(body, length, factory);
    using Outcome = Ipc::DecodedRequest::Outcome;
    switch (r.outcome) {
      case Outcome::Command:
        if (!r.cmd || r.cmd->tag() != r.tag) __builtin_trap();
        // The rest of the decoding, which the server does where the command
        // runs; a failure there ends the connection too.
        if (Ipc::finishRequest(*r.cmd)) return 0;
        break;
      case Outcome::UnknownTag:
        if (r.cmd) __builtin_trap();
        break;  // refused; the connection goes on
      case Outcome::Malformed:
        if (!r.cmd || r.problem.empty()) __builtin_trap();
        return 0;
      case Outcome::NotARequest:
      case Outcome::FactoryFailed:
        return 0;
    }
  }
  return 0;
}
