// libFuzzer target: the streaming reader of stored pack records against
// the jansson path it replaces.
//
// Input: a stored record text. Both paths must give the same record, or
// both refuse it with the same message; the streaming part alone must
// never take a text that jansson refuses.

#include <cstdint>
#include <cstdlib>
#include <string>

#include "store/stored_record_reader.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string text(reinterpret_cast<const char*>(data), size);
  constexpr std::int64_t kNow = 1'700'000'000;

  bool janssonOk = false;
  std::string janssonError;
  Ipc::PackInfoPartial want;
  try {
    want = Ipc::PackInfoPartial(json::strToObject(text), Ipc::kUseLimitSeconds, kNow);
    janssonOk = true;
  } catch (const json::Exc& e) {
    janssonError = e.what();
  }

  Ipc::PackInfoPartial fast;
  if (Ipc::tryReadStoredPackInfo(text, Ipc::kUseLimitSeconds, kNow, fast) && (!janssonOk || !(fast == want)))
    std::abort();

  try {
    const Ipc::PackInfoPartial got = Ipc::readStoredPackInfo(text, Ipc::kUseLimitSeconds, kNow);
    if (!janssonOk || !(got == want)) std::abort();
  } catch (const json::Exc& e) {
    if (janssonOk || janssonError != e.what()) std::abort();
  }
  return 0;
}
