#include "Host/Options.h"

#include <cstdlib>
#include <filesystem>
#include <map>

#include <CLI/CLI.hpp>

namespace transvale {

namespace {

constexpr char kProgramDescription[] =
    "transvale: the data-migration host. Loads the application-migration plug-in, runs its migration and "
    "shows its progress.";
constexpr char kVersion[] = "transvale 1.0.0";
constexpr int kLowestLogLevel = 0;
constexpr int kHighestLogLevel = 7;

}  // namespace

std::optional<Options> parseOptions(int argc, char** argv, int* exitCode) {
  CLI::App app(kProgramDescription, "transvale");
  app.set_version_flag("--version", kVersion);

  std::string root, plugin, log, logFormat = "text", progress = "auto";
  int systemLogLevel = 0;
  auto* rootOption = app.add_option("--root", root, "System root under which the device layout lies (default: /)")
                         ->check(CLI::ExistingDirectory);
  auto* pluginOption =
      app.add_option("--plugin", plugin, "Plug-in to load (default: ../lib/QSAppMigrator.so beside transvale)");
  auto* logOption = app.add_option(
      "--log", log, "Log file, \"-\" for standard error (default: <root>/private/var/mobile/Library/Logs/Transvale/"
                    "transvale.log)");
  app.add_option("--log-format", logFormat, "Log format")->check(CLI::IsMember({"text", "jsonl"}));
  auto* levelOption = app.add_option("--system-log-level", systemLogLevel, "Level of the system log handle (0-7)")
                          ->check(CLI::Range(kLowestLogLevel, kHighestLogLevel));
  app.add_option("--progress", progress, "Progress display")->check(CLI::IsMember({"auto", "always", "never"}));

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int code = app.exit(e);
    *exitCode = code == 0 ? 0 : kExitUsage;
    return std::nullopt;
  }

  Options options;
  if (*rootOption) {
    std::string absolute = std::filesystem::absolute(root).lexically_normal().string();
    while (absolute.size() > 1 && absolute.back() == '/') absolute.pop_back();
    options.root = absolute;
  }
  if (*pluginOption) options.plugin = plugin;
  if (*logOption) options.log = log;
  if (*levelOption) options.systemLogLevel = systemLogLevel;
  options.logFormat = logFormat == "jsonl" ? LogFormat::JSONLines : LogFormat::Text;
  static const std::map<std::string, ProgressMode> kProgressModes{
      {"auto", ProgressMode::Auto}, {"always", ProgressMode::Always}, {"never", ProgressMode::Never}};
  options.progress = kProgressModes.at(progress);
  return options;
}

}  // namespace transvale
