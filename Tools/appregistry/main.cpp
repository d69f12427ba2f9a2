// appregistry: shows what the application registry of a system root holds.
//
//   appregistry list --root DIR [--json]
//   appregistry show ID --root DIR [--json]
//
// The registry is opened for reading only: nothing under DIR changes, and a
// root without a registry database is refused rather than given one.
//
// Exit status: 0 success, 1 when there is no registry, it cannot be opened or
// `show` finds no record, 64 usage error.
#include <stdlib.h>
#include <sys/stat.h>

#include <cstdio>
#include <memory>
#include <string>

#include <CLI/CLI.hpp>

#include "Platform/Registry/RegistryReader.h"
#include "Platform/Foundation/ProjectVersion.h"
#include "Platform/Foundation/Text.h"
#include "Tools/appregistry/RecordFormat.h"

namespace {

constexpr int kExitSuccess = 0;
constexpr int kExitFailure = 1;
constexpr int kExitUsage = 64;

int fail(const std::string& message) {
  fprintf(stderr, "appregistry: %s\n", platform::printable(message).c_str());
  return kExitFailure;
}

void print(const std::string& text) {
  fwrite(text.data(), 1, text.size(), stdout);
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"Shows the records and safe harbors of the application registry of a system root, without changing "
               "anything there.",
               "appregistry"};
  app.set_version_flag("--version", platform::versionText("appregistry"));
  app.require_subcommand(1);
  std::string root;
  bool json = false;
  app.add_option("--root", root, "System root whose registry is shown")->required();
  app.add_flag("--json", json, "Write JSON instead of a table");
  CLI::App* list = app.add_subcommand("list", "Every record and every registered safe harbor");
  CLI::App* show = app.add_subcommand("show", "One record");
  std::string identifier;
  show->add_option("ID", identifier, "Bundle identifier")->required();
  list->fallthrough();
  show->fallthrough();

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int status = app.exit(e);
    return status == 0 ? kExitSuccess : kExitUsage;
  }

  // The records hold absolute paths, so the root is made absolute too.
  std::unique_ptr<char, decltype(&free)> resolved(realpath(root.c_str(), nullptr), &free);
  struct stat st;
  if (!resolved || stat(resolved.get(), &st) != 0 || !S_ISDIR(st.st_mode)) return fail(root + " is not a directory");
  root = resolved.get();
  platform::Error error;
  std::unique_ptr<platform::RegistryReader> registry = platform::RegistryReader::open(root, false, &error);
  if (!registry && error.code() == platform::kRegistryErrorNoDatabase) {
    return fail(root + " holds no application registry (no " + platform::registry::RegistryLayout(root).databasePath +
                ")");
  }
  if (!registry) return fail("cannot open the registry under " + root + ": " + error.description());

  if (list->parsed()) {
    const auto records = registry->allRecords();
    const auto harbors = registry->safeHarbors();
    print(json ? appregistry::recordsJson(records, harbors) : appregistry::recordsTable(records, harbors));
    return kExitSuccess;
  }
  const std::optional<platform::BundleRecord> record = registry->recordForIdentifier(identifier);
  if (!record) return fail("no record for " + identifier);
  print(json ? appregistry::recordJson(*record) : appregistry::recordDetails(*record));
  return kExitSuccess;
}
