// The file layer's names for the platform's descriptor and directory-stream
// owners.
#pragma once

#include "Platform/PosixHandles.h"

namespace qsfs {

using platform::ScopedDIR;
using platform::ScopedFD;

}  // namespace qsfs
