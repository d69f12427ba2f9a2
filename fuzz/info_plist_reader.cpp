// A bundle's Info.plist, read by the bundle reader (identifier, filtered
// keys) and by the registry's installation check.
#include "Platform/BundleReader.h"
#include "Platform/Registry/BundleInfo.h"
#include "fuzz/FuzzFiles.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace platform;
  static const std::string bundle = qsfuzz::scratchRoot() + "/Fuzz.app";
  if (!qsfuzz::writeInput(bundle + "/" + kInfoPlistFileName, data, size)) return 0;
  FileBundleReader reader;
  if (std::shared_ptr<Bundle> opened = reader.openBundle(URL::fileURL(bundle, true))) {
    (void)opened->identifier();
    (void)reader.infoDictionary(*opened);
    (void)reader.filteredInfoPlist(*opened, {kBundleIdentifierKey, kBundleVersionKey});
  }
  Error error;
  (void)registry::readBundleInfo(bundle, &error);
  return 0;
}
