// The command line of transvale.
#pragma once

#include <optional>
#include <string>

#include "Host/LogFile.h"

namespace transvale {

// Exit statuses.
inline constexpr int kExitMigrated = 0;
inline constexpr int kExitMigrationFailed = 1;
inline constexpr int kExitPluginUnusable = 2;
inline constexpr int kExitUsage = 64;

enum class ProgressMode { Auto, Always, Never };

struct Options {
  std::optional<std::string> root;    // --root, made absolute
  std::optional<std::string> plugin;  // --plugin
  std::optional<std::string> log;     // --log (a path or "-")
  LogFormat logFormat = LogFormat::Text;
  std::optional<int> systemLogLevel;
  ProgressMode progress = ProgressMode::Auto;
  bool plan = false;                  // --plan: a dry run
  bool json = false;                  // --json: the plan as one JSON document
  std::optional<std::string> report;  // --report FILE
};

// Parses argv. On --help or --version prints what was asked and sets *exitCode
// to 0; on a usage error prints why and sets it to kExitUsage. Either way the
// result is then none.
std::optional<Options> parseOptions(int argc, char** argv, int* exitCode);

}  // namespace transvale
