#include "FakePlatform.h"

#include <algorithm>
#include <thread>

namespace fs = std::filesystem;
using platform::Error;

namespace qstest {

namespace {

bool fail(Error* error, const std::string& message) {
  if (error) *error = Error(kFakeErrorDomain, 1, Dictionary{{platform::kLocalizedDescriptionKey, Value(message)}});
  return false;
}

std::string identifierIn(const Dictionary& options) {
  const std::string* identifier = QSStringForKey(options, platform::kBundleIdentifierKey);
  return identifier ? *identifier : std::string();
}

}  // namespace

// --- FakeApplicationRegistry ---------------------------------------------------------

platform::BundleRecord FakeApplicationRegistry::addInstalledApplication(const std::string& identifier,
                                                                        bool withDataContainer) {
  const std::string bundle = root_ + "/" + identifier + ".app";
  fs::create_directories(bundle);
  EXPECT_TRUE(place({bundle}, identifier, false, nullptr));
  if (!withDataContainer) records[identifier].dataContainerURL.reset();
  return records[identifier];
}

void FakeApplicationRegistry::note(const std::string& call, const std::string& identifier) {
  if (observer) observer(call, identifier);
  calls.push_back(call + " " + identifier);
}

bool FakeApplicationRegistry::isInstalled(const std::string& identifier) {
  note("isInstalled", identifier);
  return records.count(identifier) != 0;
}

std::optional<platform::BundleRecord> FakeApplicationRegistry::recordForIdentifier(const std::string& identifier) {
  note("recordForIdentifier", identifier);
  if (hideRecordOf.count(identifier) || !records.count(identifier)) return std::nullopt;
  return records[identifier];
}

bool FakeApplicationRegistry::place(const std::vector<std::string>& items, const std::string& identifier,
                                    bool placeholder, Error* error) {
  if (items.empty()) return fail(error, "nothing to install for " + identifier);
  const fs::path container = root_ + "/Bundle/" + identifier;
  std::error_code ec;
  fs::remove_all(container, ec);
  fs::create_directories(container, ec);
  for (const std::string& item : items) {
    if (!ec) fs::rename(item, container / fs::path(item).filename(), ec);
  }
  if (!ec) fs::create_directories(dataContainerPath(identifier), ec);
  if (ec) return fail(error, "cannot install " + identifier + ": " + ec.message());

  platform::BundleRecord& record = records[identifier] = platform::BundleRecord{};
  record.identifier = identifier;
  record.bundleType = placeholder ? platform::kBundleTypePlaceholder : platform::kBundleTypeUser;
  const auto app = std::find_if(items.begin(), items.end(), [](auto& i) { return fs::path(i).extension() == ".app"; });
  record.bundleURL =
      URL::fileURL((container / fs::path(app == items.end() ? items[0] : *app).filename()).string(), true);
  record.bundleContainerURL = URL::fileURL(container.string(), true);
  record.dataContainerURL = URL::fileURL(dataContainerPath(identifier), true);
  record.foundBackingBundle = true;
  record.isPlaceholder = placeholder;
  if (placeholder) return true;
  record.groupContainerURLs.emplace();
  for (const std::string& group : groupsOf[identifier]) {
    fs::create_directories(root_ + "/Shared/" + group);
    (*record.groupContainerURLs)[group] = URL::fileURL(root_ + "/Shared/" + group, true);
  }
  return true;
}

bool FakeApplicationRegistry::installPackage(const URL& package, const Dictionary& options,
                                             const platform::InstallProgressCallback& progress, Error* error) {
  const std::string identifier = identifierIn(options);
  note("installPackage", identifier);
  installCalls.push_back({package, options});
  std::vector<Dictionary> reports = reportsFirst;
  bool installed = false;
  if (refuseInstallOf.count(identifier)) {
    reports.push_back(Dictionary{{platform::kRegistryProgressErrorKey, Value("InstallFailed")},
                                 {platform::kRegistryProgressErrorDescriptionKey, Value("refused by the test")}});
    fail(error, "installation of " + identifier + " refused");
  } else {
    std::vector<std::string> items;
    for (const std::string& name : directoryNames(package.path() + "/Payload")) {
      items.push_back(package.path() + "/Payload/" + name);
    }
    installed = place(items, identifier, false, error);
    if (installed) fs::remove_all(package.path());
  }
  // Reports come from a thread of the registry's, as they do from the real one.
  std::thread([&] {
    for (const Dictionary& report : reports) progress(report);
  }).join();
  return installed;
}

bool FakeApplicationRegistry::installBundle(const URL& bundle, const Dictionary& options, Error* error) {
  const std::string identifier = identifierIn(options);
  note("installBundle", identifier);
  installCalls.push_back({bundle, options});
  if (refuseInstallOf.count(identifier)) return fail(error, "installation of " + identifier + " refused");
  return place({bundle.path()}, identifier, true, error);
}

// --- The other fakes -------------------------------------------------------------------

std::unique_ptr<platform::ImageEncoder> FaultyImageEncoding::createEncoder(platform::Data& buffer,
                                                                           std::string_view typeIdentifier,
                                                                           size_t imageCount) {
  // Takes the image but reports that nothing was written.
  struct FailingFinalize final : platform::ImageEncoder {
    void addImage(const platform::Image&) override {}
    bool finalize() override { return false; }
  };
  if (failCreate) return nullptr;
  if (failFinalize) return std::make_unique<FailingFinalize>();
  return inner_.createEncoder(buffer, typeIdentifier, imageCount);
}

FakePlatform::FakePlatform(const std::string& root)
    : registry(root + "/containers"), temporaryDirectory(root + "/tmp") {
  fs::create_directories(temporaryDirectory);
  systemVersion.dictionary = Dictionary{{platform::kSystemVersionBuildVersionKey, Value("21A100")},
                                        {platform::kSystemVersionProductVersionKey, Value("21.0")}};
}

QSMigratorServices FakePlatform::services() {
  const URL temporary = URL::fileURL(temporaryDirectory, true);
  return {&registry, &daemon, &bundleReader, &iconRenderer, &imageEncoding, &systemVersion, temporary};
}

// --- MigratorTest ----------------------------------------------------------------------------

namespace {
void removeLayout() {
  std::error_code ec;
  fs::remove_all(systemRoot() + "/private", ec);
  ASSERT_FALSE(ec) << "cannot clear the layout: " << ec.message();
}
}  // namespace

void MigratorTest::SetUp() {
  removeLayout();
  scratch_ = std::make_unique<TempDir>("migrator");
  platform_ = std::make_unique<FakePlatform>(scratch_->path());
  log_ = std::make_unique<LogCapture>();
}

void MigratorTest::TearDown() {
  for (const std::string& path : immutable_) setImmutable(path, false);
  migrator_.reset();
  log_.reset();
  platform_.reset();
  scratch_.reset();
  removeLayout();
}

testing::AssertionResult MigratorTest::loggedOnce(const std::string& message, bool prefix) const {
  const auto lines = log_->hostMessages();
  const auto count = std::ranges::count_if(lines, [&](const std::string& line) {
    return prefix ? line.starts_with(message) : line == message;
  });
  if (count == 1) return testing::AssertionSuccess();
  return testing::AssertionFailure() << count << " lines " << (prefix ? "start with" : "are") << " \"" << message
                                     << "\" among " << testing::PrintToString(lines);
}

std::vector<std::string> directoryNames(const std::string& path) {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& entry : fs::directory_iterator(path, ec)) names.push_back(entry.path().filename().string());
  std::sort(names.begin(), names.end());
  return names;
}

}  // namespace qstest
