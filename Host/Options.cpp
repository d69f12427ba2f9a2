#include "Host/Options.h"

#include <cstdlib>
#include <filesystem>
#include <map>

#include <CLI/CLI.hpp>

#include "Platform/Foundation/ProjectVersion.h"

namespace transvale {

namespace {

constexpr char kProgramDescription[] =
    "The data-migration host. Loads the application-migration plug-in, runs its migration and shows its "
    "progress; or, with --plan, shows what the migration would do without changing anything.";
constexpr char kProgramName[] = "transvale";
constexpr int kLowestLogLevel = 0;
constexpr int kHighestLogLevel = 7;

}  // namespace

std::optional<Options> parseOptions(int argc, char** argv, int* exitCode) {
  CLI::App app(kProgramDescription, kProgramName);
  app.set_version_flag("--version", platform::versionText(kProgramName));
  app.footer(
      "Exit status: 0 migration succeeded (or plan shown), 1 migration failed, 2 plug-in unusable, 64 usage "
      "error.");

  std::string root, plugin, log, logFormat = "text", progress = "auto";
  int systemLogLevel = 0;
  auto* rootOption = app.add_option("--root", root, "System root under which the device layout lies (default: /)")
                         ->check(CLI::ExistingDirectory);
  auto* pluginOption =
      app.add_option("--plugin", plugin,
                     "Plug-in to load (default: the one built beside transvale, or the installed one)");
  auto* logOption = app.add_option(
      "--log", log, "Log file, \"-\" for standard error (default: <root>/private/var/mobile/Library/Logs/Transvale/"
                    "transvale.log)");
  app.add_option("--log-format", logFormat, "Log format")->check(CLI::IsMember({"text", "jsonl"}));
  auto* levelOption = app.add_option("--system-log-level", systemLogLevel, "Level of the system log handle (0-7)")
                          ->check(CLI::Range(kLowestLogLevel, kHighestLogLevel));
  app.add_option("--progress", progress,
                 "Progress on standard error: auto (a bar on a terminal, a line per step otherwise), always (the "
                 "bar), never")
      ->check(CLI::IsMember({"auto", "always", "never"}));
  bool plan = false, json = false;
  std::string report;
  app.add_flag("--plan", plan,
               "Show what the migration would do, changing nothing on disk (no log file unless --log is given)");
  auto* jsonOption = app.add_flag("--json", json, "With --plan: the plan as one JSON document");
  auto* reportOption =
      app.add_option("--report", report, "Write the outcome of every container as one JSON document to FILE");
  jsonOption->needs(app.get_option("--plan"));
  reportOption->excludes(app.get_option("--plan"));

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
  if (*reportOption) options.report = report;
  options.plan = plan;
  options.json = json;
  if (*levelOption) options.systemLogLevel = systemLogLevel;
  options.logFormat = logFormat == "jsonl" ? LogFormat::JSONLines : LogFormat::Text;
  static const std::map<std::string, ProgressMode> kProgressModes{
      {"auto", ProgressMode::Auto}, {"always", ProgressMode::Always}, {"never", ProgressMode::Never}};
  options.progress = kProgressModes.at(progress);
  return options;
}

}  // namespace transvale
