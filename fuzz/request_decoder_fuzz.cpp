// libFuzzer target for the payload decoders of every command.
//
// Input: one tag byte, then a payload. The payload is read as that
// command's request (what the server decodes) and as its answer (what the
// client decodes). Decoding must either refuse the input with
// wire::DecodeError or json::Exc, or accept it; whatever it accepts must
// encode again to bytes that decode to the same encoding (so the writer and
// the reader agree on every field).

#include <cstdint>
#include <cstring>
#include <memory>
#include <string>

#include "protocol/commands.h"

namespace {

std::string encode(const Ipc::CmdI& cmd, bool request) {
  const wire::OutFrame f = request ? cmd.requestFrame() : cmd.answerFrame();
  return f.head.substr(wire::kHeaderSize) + std::string(f.tail.view());
}

bool decode(Ipc::CmdI& cmd, const std::string& payload, bool request) {
  std::shared_ptr<unsigned char> owner(ExportedUCharAlloc::alloc(payload.size() + 1), ExportedUCharAlloc());
  if (!payload.empty()) std::memcpy(owner.get(), payload.data(), payload.size());
  wire::Reader in(owner, payload.size());
  try {
    if (request) {
      // What the server does with a request: read it, then finish it where
      // the command runs.
      cmd.readRequest(in);
      cmd.finishRequest();
    } else {
      cmd.readAnswer(in);
    }
    return true;
  } catch (const wire::DecodeError&) {
    return false;
  } catch (const json::Exc&) {
    return false;
  }
}

void check(std::uint8_t tag, const std::string& payload, bool request) {
  auto first = Ipc::DB::makeCommand(tag, nullptr);
  if (!first || !decode(*first, payload, request)) return;
  const std::string once = encode(*first, request);
  auto second = Ipc::DB::makeCommand(tag, nullptr);
  if (!decode(*second, once, request)) __builtin_trap();   // we wrote what we cannot read
  if (encode(*second, request) != once) __builtin_trap();  // a field changed on the way
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size == 0) return 0;
  // Unknown tags fold onto the table, so every input exercises a decoder.
  const auto& table = Ipc::DB::kCommandTable;
  std::uint8_t tag = data[0];
  if (!Ipc::DB::makeCommand(tag, nullptr)) tag = table[data[0] % table.size()].tag;
  const std::string payload(reinterpret_cast<const char*>(data + 1), size - 1);
  check(tag, payload, true);
  check(tag, payload, false);
  try {
    wire::Reader in(payload);
    Ipc::DB::ProgressCmdsBase::readProgress(in);
  } catch (const wire::DecodeError&) {
  }
  return 0;
}
