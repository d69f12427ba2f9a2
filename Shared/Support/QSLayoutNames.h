// Names of the files, items and keys of the migrator's layout: what the
// configuration's paths end in and what the files there hold. The migrator,
// the configuration and the tools that make and check device images all
// spell them from here.
#pragma once

#include "Platform/Registry/ApplicationRegistry.h"

// The per-container migration marker.
inline constexpr char kQSMigrationMarkerFileName[] = "com.vantrel.quill.set.container_migrator.plist";
// The safe-harbor map in the data directory.
inline constexpr char kQSSafeHarborMapFileName[] = "SafeHarbor.plist";
// The old layout's install map, its group-container entries, and the safe-harbor entries.
inline constexpr char kQSInstallMapGroupContainersKey[] = "GroupContainers";
inline constexpr char kQSGroupContainerPathKey[] = "Container";
inline constexpr char kQSHarborPathKey[] = "HarborPathKey";
// The last-system-version record in the data directory.
inline constexpr char kQSLastSystemVersionFileName[] = "AppMigratorLastSystemVersion.plist";
// A note the previous release may leave among the containers; not a container.
inline constexpr char kQSOldApplicationsNoteFileName[] = "WhereDidMyApplicationsGo.txt";

// The store-metadata items of an application's container, in the order they
// are captured (appBundleMetadataItemNames). The metadata file's name is the
// registry's, which installs it beside the bundle.
inline constexpr char kQSStoreManifestItemName[] = "Manifest.plist";
inline constexpr char kQSStoreArtworkItemName[] = "VendraArtwork";
inline constexpr const char* kQSStoreMetadataItemName = platform::kStoreMetadataFileName;
inline constexpr char kQSStoreGeoJSONItemName[] = "GeoJSON";
