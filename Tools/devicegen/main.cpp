// devicegen: makes old-layout device images and verifies migrated ones.
//
//   devicegen create --root DIR --apps N [--vpn-only K] [--groups G]
//       [--files-per-app F] [--bytes-per-file B] [--harbors H]
//       [--placeholders P] [--builtin-older K2] [--seed S]
//   devicegen verify --root DIR [--json]
//
// Exit status: 0 success, 1 failure (create could not write the image, or
// verify found problems), 64 usage error.
#include <chrono>
#include <cstdio>
#include <string>

#include <CLI/CLI.hpp>

#include "Platform/Foundation/ProjectVersion.h"
#include "Platform/Foundation/Text.h"
#include "Tools/devicegen/FileOps.h"
#include "Tools/devicegen/Generator.h"
#include "Tools/devicegen/Layout.h"
#include "Tools/devicegen/Verifier.h"

namespace {

constexpr int kExitSuccess = 0;
constexpr int kExitFailure = 1;
constexpr int kExitUsage = 64;

int fail(const std::string& message) {
  fprintf(stderr, "devicegen: %s\n", platform::printable(message).c_str());
  return kExitFailure;
}

int runCreate(devicegen::ImageOptions options) {
  if (const std::string problem = devicegen::checkImageOptions(options); !problem.empty()) {
    fprintf(stderr, "devicegen create: %s\n", problem.c_str());
    return kExitUsage;
  }
  std::string why;
  if (!devicegen::makeDirectories(options.root, &why)) return fail(why);
  const std::optional<std::string> root = devicegen::canonicalDirectory(options.root, &why);
  if (!root) return fail(why);
  // An image lies beside what it imitates; over the real system it would
  // mix with the real layout.
  if (*root == "/") return fail("refusing to write an image over /");
  options.root = *root;
  const devicegen::DeviceLayout layout(*root);
  if (devicegen::itemKind(layout.manifest()) != devicegen::ItemKind::Missing) {
    return fail(*root + " already holds an image (" + layout.manifest() + ")");
  }
  const auto start = std::chrono::steady_clock::now();
  devicegen::Manifest manifest;
  if (!devicegen::createImage(options, &manifest, &why)) return fail(why);
  const double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  printf("devicegen create: %s\n", platform::printable(*root).c_str());
  printf(
      "  applications: %llu (%llu placeholders, %llu with a newer built-in copy), VPN-only containers: %llu, "
      "groups: %llu, safe harbors: %llu\n",
      static_cast<unsigned long long>(options.applications), static_cast<unsigned long long>(options.placeholders),
      static_cast<unsigned long long>(options.builtInOlder), static_cast<unsigned long long>(options.vpnOnly),
      static_cast<unsigned long long>(options.groups), static_cast<unsigned long long>(options.harbors));
  printf("  files: %llu (%llu bytes), seed %llu, %.2f s\n", static_cast<unsigned long long>(manifest.fileCount()),
         static_cast<unsigned long long>(manifest.byteCount()), static_cast<unsigned long long>(options.seed), seconds);
  return kExitSuccess;
}

int runVerify(const std::string& rootArgument, bool json) {
  std::string why;
  const std::optional<std::string> root = devicegen::canonicalDirectory(rootArgument, &why);
  if (!root) return fail(why);
  const devicegen::VerifyResult result = devicegen::verifyImage(*root);
  if (json) {
    const std::string text = devicegen::verifyResultJSON(*root, result);
    fwrite(text.data(), 1, text.size(), stdout);
  } else {
    devicegen::printVerifyResult(*root, result, stdout);
  }
  return result.ok() ? kExitSuccess : kExitFailure;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"Makes old-layout device images and verifies migrated ones.", "devicegen"};
  app.set_version_flag("--version", platform::versionText("devicegen"));
  app.footer("Exit status: 0 success, 1 failure (create could not write the image, or verify found problems), 64 "
             "usage error.");
  app.require_subcommand(1);

  devicegen::ImageOptions options;
  CLI::App* create = app.add_subcommand("create", "Write an old-layout device image and its manifest");
  create->add_option("--root", options.root, "Directory of the image (created when missing)")->required();
  create->add_option("--apps", options.applications, "Number of application containers")->required();
  create->add_option("--vpn-only", options.vpnOnly, "Containers holding only a VPN plug-in");
  create->add_option("--groups", options.groups, "Old group containers in the install map");
  create->add_option("--files-per-app", options.filesPerApp, "Generated files per container")->capture_default_str();
  create->add_option("--bytes-per-file", options.bytesPerFile, "Mean size of a generated file")->capture_default_str();
  create->add_option("--harbors", options.harbors, "Entries of the safe-harbor map");
  create->add_option("--placeholders", options.placeholders, "Applications whose bundle is a placeholder");
  create->add_option("--builtin-older", options.builtInOlder,
                     "Applications with an equal or newer built-in copy (the registry refuses them)");
  create->add_option("--seed", options.seed, "Seed of every choice")->capture_default_str();

  std::string verifyRoot;
  CLI::App* verify = app.add_subcommand("verify", "Check a migrated image against its manifest");
  verify->add_option("--root", verifyRoot, "Directory of the image")->required();
  bool verifyJSON = false;
  verify->add_flag("--json", verifyJSON, "Write the result as one JSON document");

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int status = app.exit(e);
    return status == 0 ? kExitSuccess : kExitUsage;
  }
  if (create->parsed()) return runCreate(options);
  return runVerify(verifyRoot, verifyJSON);
}
