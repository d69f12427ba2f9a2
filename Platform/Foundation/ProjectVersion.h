// The version line every program of the project (the host and the tools)
// prints for --version.
#pragma once

#include <string>

namespace platform {

// The project's version, set by the build.
#ifndef QS_PROJECT_VERSION
#define QS_PROJECT_VERSION "0"
#endif
inline constexpr char kProjectVersion[] = QS_PROJECT_VERSION;
inline constexpr char kProjectName[] = "Quillset";

// "<program> (Quillset) <version>", the form help2man reads.
inline std::string versionText(const std::string& program) {
  return program + " (" + kProjectName + ") " + kProjectVersion;
}

}  // namespace platform
