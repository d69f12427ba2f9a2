// Property lists from memory and from a file: parse, and write back what parsed.
#include "Platform/Foundation/PropertyList.h"
#include "fuzz/FuzzFiles.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace platform;
  std::optional<Value> parsed = plist::parse(data, size);
  if (parsed) (void)plist::serialize(*parsed, plist::Format::Binary);
  static const std::string file = qsfuzz::scratchRoot() + "/input.plist";
  if (qsfuzz::writeInput(file, data, size)) (void)plist::readDictionary(URL::fileURL(file));
  return 0;
}
