// Path containment: deciding whether a path found inside untrusted content
// lies inside a base directory once every symbolic link is resolved, even when
// the tail of the path does not exist yet.
//
// The decision is made in layers, each of which rejects on its own with one
// level-3 line saying why; no error record is created.
#include <limits.h>
#include <stdlib.h>

#include <cerrno>
#include <string>
#include <string_view>
#include <vector>

#include "Platform/Foundation/PathContainment.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/FileManager/QuillsetAdditions.h"
#include "Platform/FileTree/SymlinkText.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLog.h"

using platform::URL;

namespace {

constexpr char kRealPathForURLFn[] = "-[QSFileManager realPathForURL:ifChildOfURL:]";
constexpr char kRealPathAllowingMissingFn[] = "-[QSFileManager _realPathForURL:allowNonExistentPathComponents:]";
constexpr char kRealPathWhatExistsFn[] = "-[QSFileManager _realPathWhatExistsInPath:]";

// A leading "/private" names the same place as the path without it.
constexpr std::string_view kPrivatePrefix = "/private/";
constexpr size_t kPrivatePrefixDropLength = 8;  // "/private", keeping the separator after it
constexpr std::string_view kPrivateComponent = "private";

constexpr std::string_view kRootComponent = "/";
constexpr std::string_view kCurrentComponent = ".";
constexpr std::string_view kParentComponent = "..";

// A real path has at least the root and one name.
constexpr size_t kMinRealComponentCount = 2;

// The path without a leading "/private" ("/private" alone stays as it is).
URL withoutPrivatePrefix(const URL& url) {
  const std::string& path = url.path();
  if (path.compare(0, kPrivatePrefix.size(), kPrivatePrefix) != 0) return url;
  return URL::fileURL(std::string_view(path).substr(kPrivatePrefixDropLength));
}

// Components [begin, end) joined back into one path.
std::string joinComponents(const std::vector<std::string>& components, size_t begin, size_t end) {
  std::string out;
  for (size_t i = begin; i < end; ++i) {
    out = out.empty() ? components[i] : platform::path::join(out, components[i]);
  }
  return out;
}

// The path without its last component: "/c/link" gives "/c", "/link" gives
// "/", "link" gives "".
std::string deletingLastComponent(const std::string& path) {
  size_t slash = path.rfind('/');
  if (slash == std::string::npos) return "";
  if (slash == 0) return "/";
  return path.substr(0, slash);
}

// Index of the first component to compare: a component 1 of "private" is
// skipped so that /private/var/x and /var/x compare as the same place.
size_t firstComparedComponent(const std::vector<std::string>& components) {
  return components[1] == kPrivateComponent ? 2 : 1;
}

enum class LinkCheck { NotALink, AcceptedLink, Rejected };

// Reads `suspicious` as a symbolic link and, when it is one, checks that its
// text is relative and never climbs above the base directory.
LinkCheck checkLink(const QSFileManager& fm, const std::string& suspicious, const std::string& base) {
  std::string linkText;
  if (int err = platform::fs::readSymlinkText(suspicious.c_str(), &linkText); err != 0) {
    if (err == EINVAL || err == ENOENT) return LinkCheck::NotALink;
    QS_SYSLOG(kQSLogLevelError, kRealPathForURLFn, "Readlink failed: %s", QSErrorText(err));
    return LinkCheck::Rejected;
  }
  if (!linkText.empty() && linkText.front() == '/') {
    QS_SYSLOG(kQSLogLevelError, kRealPathForURLFn, "Rejecting %@ -> %s, as absolute symlinks are not allowed",
              suspicious, linkText);
    return LinkCheck::Rejected;
  }
  uint32_t baseDepth = 0;
  if (!fm._validateSymlink(&base, 0, &baseDepth)) {
    QS_SYSLOG(kQSLogLevelError, kRealPathForURLFn, "Failed to retrieve depth of %@", base);
    return LinkCheck::Rejected;
  }
  // The link's target as seen from the base: the link's directory inside the
  // base, followed by the link text.
  std::string target = platform::path::join(deletingLastComponent(suspicious.substr(base.size())), linkText);
  if (!fm._validateSymlink(&target, baseDepth, nullptr)) {
    QS_SYSLOG(kQSLogLevelError, kRealPathForURLFn, "Rejecting %@ -> %@, as it is points outside or to the base %@",
              suspicious, target, base);
    return LinkCheck::Rejected;
  }
  return LinkCheck::AcceptedLink;
}

// True when the real path `suspiciousReal` lies inside (or is) `baseReal`,
// compared component by component; otherwise one line saying why.
bool realPathsNest(const std::string& suspicious, const std::string& base, const std::string& suspiciousReal,
                   const std::string& baseReal) {
  std::vector<std::string> b = platform::path::components(baseReal);
  std::vector<std::string> s = platform::path::components(suspiciousReal);
  if (b.size() < kMinRealComponentCount || s.size() < kMinRealComponentCount) {
    QS_SYSLOG(kQSLogLevelError, kRealPathForURLFn,
              "Rejecting %@ with base %@ because real component counts don't make sense (reals %@ ; %@)", suspicious,
              base, suspiciousReal, baseReal);
    return false;
  }
  size_t bi = firstComparedComponent(b);
  size_t si = firstComparedComponent(s);
  if (b.size() - bi > s.size() - si) {
    QS_SYSLOG(kQSLogLevelError, kRealPathForURLFn,
              "Rejecting %@ with base %@ because base component count is greater than child component count "
              "(reals %@ ; %@)",
              suspicious, base, suspiciousReal, baseReal);
    return false;
  }
  for (; bi < b.size(); ++bi, ++si) {
    if (b[bi] != s[si]) {
      QS_SYSLOG(kQSLogLevelError, kRealPathForURLFn,
                "Rejecting %@ with base %@ (reals %@ ; %@) because components diverge at %@ != %@", suspicious, base,
                suspiciousReal, baseReal, b[bi], s[si]);
      return false;
    }
  }
  return true;
}

}  // namespace

std::optional<URL> QSFileManager::realPathForURL(const URL& url, const URL& ifChildOfURL) const {
  if (url.empty() || ifChildOfURL.empty()) {
    QS_SYSLOG(kQSLogLevelError, kRealPathForURLFn, "The base path %@ and/or suspicious path %@ were nil", ifChildOfURL,
              url);
    return std::nullopt;
  }
  const URL suspiciousURL = withoutPrivatePrefix(url);
  const URL baseURL = withoutPrivatePrefix(ifChildOfURL);
  const std::string& suspicious = suspiciousURL.path();
  const std::string& base = baseURL.path();

  if (suspicious.compare(0, base.size(), base) != 0) {
    QS_SYSLOG(kQSLogLevelError, kRealPathForURLFn, "supiscious path %@ does not contain base path %@ as a prefix",
              suspicious, base);
    return std::nullopt;
  }
  if (QuillsetAdditions::containsDotDotPathComponents(suspicious)) {
    QS_SYSLOG(kQSLogLevelError, kRealPathForURLFn, "The suspicious path %@ contains '..' paths, which are invalid",
              suspicious);
    return std::nullopt;
  }
  if (checkLink(*this, suspicious, base) == LinkCheck::Rejected) return std::nullopt;

  std::optional<URL> baseReal = _realPathForURL(baseURL, false);
  if (!baseReal) {
    QS_SYSLOG(kQSLogLevelError, kRealPathForURLFn, "Failed to retrieve realpath for base path %@ ", base);
    return std::nullopt;
  }
  std::optional<URL> suspiciousReal = _realPathForURL(suspiciousURL, true);
  if (!suspiciousReal) {
    QS_SYSLOG(kQSLogLevelError, kRealPathForURLFn, "Failed to retrieve realpath for suspicious path %@", suspicious);
    return std::nullopt;
  }
  // Links get the same component comparison as plain paths: the textual
  // check of a link cannot see a link earlier in a chain, nor a ".." that
  // follows a linked directory in the text, and either can carry the real
  // target out of the base.
  if (!realPathsNest(suspicious, base, suspiciousReal->path(), baseReal->path())) return std::nullopt;
  return suspiciousReal;
}

bool QSFileManager::urlLiesInsideURL(const URL& url, const URL& base, bool orIsBase) const {
  return orIsBase ? platform::path::liesInsideOrAt(url.path(), base.path())
                  : platform::path::liesInside(url.path(), base.path());
}

std::optional<std::string> QSFileManager::resolvedPathOfURL(const URL& url) const {
  return platform::path::resolvedAsFarAsExists(url.path());
}

bool QSFileManager::resolvedPathLiesInside(const std::optional<std::string>& path,
                                           const std::optional<std::string>& base, bool orIsBase) const {
  const platform::path::Placement placement = platform::path::placementOfResolved(path, base);
  return placement == platform::path::Placement::Inside || (orIsBase && placement == platform::path::Placement::Same);
}

std::optional<URL> QSFileManager::_realPathForURL(const URL& url, bool allowNonExistentPathComponents) const {
  // glibc's realpath writes up to PATH_MAX bytes into the buffer it is given,
  // so the buffer must be that large; it is zeroed so that what the resolver
  // leaves behind on failure is a terminated string.
  char resolved[PATH_MAX] = {};
  if (realpath(url.fileSystemRepresentation(), resolved)) {
    return URL::fileURL(QuillsetAdditions::stringWithFileSystemRepresentation(resolved));
  }
  int err = errno;
  if (err == ENOENT && allowNonExistentPathComponents) return _realPathWhatExistsInPath(url.path());
  QS_SYSLOG(kQSLogLevelError, kRealPathAllowingMissingFn, "Failed to realpath %s : %s at %s", url.path(),
            QSErrorText(err), static_cast<const char*>(resolved));
  return std::nullopt;
}

std::optional<URL> QSFileManager::_realPathWhatExistsInPath(const std::string& path) const {
  std::vector<std::string> components = platform::path::components(path);
  const size_t n = components.size();
  for (size_t k = n; k >= kMinRealComponentCount; --k) {
    URL existing = URL::fileURL(joinComponents(components, 0, k));
    if (!itemExistsAtURL(existing)) continue;
    std::optional<URL> real = _realPathForURL(existing, false);
    if (!real) continue;
    std::string rest = joinComponents(components, k, n);
    QS_SYSLOG(kQSLogLevelDebug, kRealPathWhatExistsFn, "Realpathed %@ ; appending non-existing components %@",
              real->path(), rest);
    return URL::fileURL(platform::path::join(real->path(), rest));
  }
  return std::nullopt;
}

bool QSFileManager::_validateSymlink(const std::string* path, uint32_t withStartingDepth,
                                     uint32_t* andEndingDepth) const {
  if (!path) return false;
  const int32_t start = static_cast<int32_t>(withStartingDepth);
  int32_t depth = start;
  for (const std::string& component : platform::path::components(*path)) {
    if (component == kParentComponent) {
      --depth;
    } else if (!component.empty() && component != kRootComponent && component != kCurrentComponent) {
      ++depth;
    }
    if (depth < start) return false;
  }
  if (andEndingDepth) *andEndingDepth = static_cast<uint32_t>(depth);
  return true;
}
