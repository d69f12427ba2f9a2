// Listing and introspection of a large old layout: creation of the migrator
// (which lists the old applications directory) and the introspection of every
// entry, as the run's first pass does. The tree is generated once under a
// private system root: 5,000 containers, each with an application bundle, a VPN
// plug-in in every tenth, and user data that introspection must not descend
// into.
#include <stdlib.h>
#include <sys/resource.h>

#include <filesystem>
#include <fstream>
#include <string>

#include <benchmark/benchmark.h>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Host/HostLog.h"
#include "Shared/Support/QSGlobalConfiguration.h"

namespace fs = std::filesystem;

namespace {

constexpr int kContainers = 5000;
constexpr int kFilesPerContainer = 4;

std::string gRoot;

void writeText(const fs::path& path, const std::string& text) { std::ofstream(path) << text; }

void writeInfoPlist(const fs::path& bundle, const std::string& identifier) {
  fs::create_directories(bundle);
  writeText(bundle / "Info.plist",
            "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict><key>RkBundleIdentifier</key>"
            "<string>" + identifier + "</string></dict></plist>\n");
}

void generateTree() {
  const fs::path applications = QSGlobalConfiguration::sharedInstance().oldContainerPath().path();
  for (int i = 0; i < kContainers; ++i) {
    const fs::path container = applications / ("container-" + std::to_string(i));
    const std::string identifier = "com.example.app" + std::to_string(i);
    writeInfoPlist(container / "App.app", identifier);
    if (i % 10 == 0) writeInfoPlist(container / "Tunnel.vpnplugin", identifier + ".tunnel");
    fs::create_directories(container / "Documents");
    fs::create_directories(container / "Library/Preferences");
    fs::create_directories(container / "tmp");
    for (int f = 0; f < kFilesPerContainer; ++f) writeText(container / "Documents" / std::to_string(f), "data");
  }
}

long maxResidentKilobytes() {
  struct rusage usage {};
  getrusage(RUSAGE_SELF, &usage);
  return usage.ru_maxrss;
}

void BM_ListAndIntrospect(benchmark::State& state) {
  platform::FileBundleReader bundleReader;
  QSMigratorServices services;
  services.bundleReader = &bundleReader;
  size_t found = 0;
  for (auto _ : state) {
    std::unique_ptr<QSAppMigrator> migrator = QSAppMigrator::create(services);
    if (!migrator || !migrator->itemsToMigrate()) {
      state.SkipWithError("the migrator found no entries");
      return;
    }
    found = 0;
    for (const platform::URL& entry : *migrator->itemsToMigrate()) {
      bool early = false;
      found += migrator->_introspectContainer(entry, &early).has_value();
    }
  }
  state.counters["containers"] = static_cast<double>(found);
  state.counters["maxRSS_KiB"] = static_cast<double>(maxResidentKilobytes());
}
BENCHMARK(BM_ListAndIntrospect)->Unit(benchmark::kMillisecond)->Iterations(5);

}  // namespace

int main(int argc, char** argv) {
  const char* tmp = getenv("TMPDIR");
  std::string pattern = std::string(tmp && *tmp ? tmp : "/tmp") + "/qs-bench-introspection.XXXXXX";
  if (!mkdtemp(pattern.data())) return 2;
  gRoot = pattern;
  setenv("QS_SYSTEM_ROOT", gRoot.c_str(), 1);
  generateTree();
  // The run's own time: the host's log writing is not part of it.
  platform::setHostLogSink([](const platform::HostLogLine&) {});

  benchmark::Initialize(&argc, argv);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  std::error_code ec;
  fs::remove_all(gRoot, ec);
  return 0;
}
