// Capture of the store-supplied items that travel beside a bundle.
#include <array>

#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLayoutNames.h"

using platform::Error;
using platform::URL;

namespace {

constexpr char kCaptureStoreDataFn[] =
    "-[QSFileManager captureStoreDataFromDirectory:toDirectory:doCopy:failureIsFatal:withError:]";

// The store items in the order they are captured, each with the key that
// names its failure.
struct StoreItem {
  const char* name;
  const char* failureKey;
};
constexpr std::array<StoreItem, 4> kStoreItems = {{
    {kQSStoreManifestItemName, "ManifestCaptureFailed"},
    {kQSStoreArtworkItemName, "VendraArtworkCaptureFailed"},
    {kQSStoreMetadataItemName, "VendraMetadataCaptureFailed"},
    {kQSStoreGeoJSONItemName, "GeoJSONCaptureFailed"},
}};

}  // namespace

bool QSFileManager::captureStoreDataFromDirectory(const URL& source, const URL& toDirectory, bool doCopy,
                                                  bool failureIsFatal, Error* withError) const {
  for (const StoreItem& item : kStoreItems) {
    const URL from = source.appending(item.name);
    const URL to = toDirectory.appending(item.name);
    Error failure;
    const bool captured =
        doCopy ? copyItemIfExistsAtURL(from, to, &failure) : moveItemIfExistsAtURL(from, to, &failure);
    if (captured) continue;

    platform::Dictionary info{{kQSLegacyErrorStringKey, platform::Value(item.failureKey)}};
    Error error =
        _CreateAndLogError(kCaptureStoreDataFn, __LINE__, QSInstallerErrorDomain, kQSErrorCodeStoreDataCaptureFailed,
                           &failure, &info, doCopy ? "Failed to copy %@ to %@" : "Failed to move %@ to %@", from, to);
    if (failureIsFatal) return QSFail(withError, std::move(error));
  }
  return true;
}
