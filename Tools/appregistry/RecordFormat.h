// How appregistry shows registry records and safe harbors: an aligned text
// table (list), a block of labelled lines (show), or JSON (--json, see
// Platform/Foundation/Json.h for how bytes that are not UTF-8 are written).
//
// Every name printed as text goes through platform::printable, so a file name
// with control characters or invalid bytes cannot disturb the terminal.
// Thread safety: pure functions.
#pragma once

#include <string>
#include <vector>

#include "Platform/Registry/SQLiteRegistry.h"

namespace appregistry {

std::string recordsTable(const std::vector<platform::BundleRecord>& records,
                         const std::vector<platform::SafeHarborRecord>& harbors);
std::string recordDetails(const platform::BundleRecord& record);

std::string recordsJson(const std::vector<platform::BundleRecord>& records,
                        const std::vector<platform::SafeHarborRecord>& harbors);
std::string recordJson(const platform::BundleRecord& record);

}  // namespace appregistry
