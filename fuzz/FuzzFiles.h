// A scratch system root for the fuzz targets, and writing one input into a
// file of it (the readers under test read files, never memory).
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

namespace qsfuzz {

// The root: a fresh directory under $TMPDIR, made once, set as QS_SYSTEM_ROOT.
const std::string& scratchRoot();
// Writes the bytes to `path` (replacing it), making its directory; false on failure.
bool writeInput(const std::string& path, const uint8_t* data, size_t size);

}  // namespace qsfuzz
