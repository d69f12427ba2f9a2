// The verifier of migrated device images: compares what the manifest
// promised with what the registry and the file system hold after a
// migration.
//
// It asks the registry (SQLiteApplicationRegistry under the image's root) for
// every application's record and data container, the group containers of
// every record and the registered safe harbors, and checks that every item of
// the manifest lies in its new container unchanged (size and SHA-256 of
// files, text of symbolic links, directories), that nothing of the old layout
// is left, that every application is installed (and not a placeholder unless
// it was one before), and that the recorded last system version equals the
// system's.
//
// Thread safety: one verification runs on one thread.
#pragma once

#include <cstdint>
#include <cstdio>
#include <string>
#include <vector>

namespace devicegen {

enum class ProblemKind { Missing, Changed, LeftBehind, Registry, Version, Count };

struct Problem {
  ProblemKind kind;
  std::string text;  // printable (names escaped)
};

struct VerifySummary {
  uint64_t applications = 0;
  uint64_t placeholders = 0;
  uint64_t builtInRefusals = 0;
  uint64_t vpnOnlyContainers = 0;
  uint64_t groups = 0;
  uint64_t harbors = 0;
  uint64_t files = 0;
  uint64_t bytes = 0;
  uint64_t directories = 0;
  uint64_t links = 0;
};

// How many problems are kept for the report; the rest are only counted.
inline constexpr size_t kListedProblemLimit = 40;

struct VerifyResult {
  std::string fatal;  // set when the verification could not be made at all
  VerifySummary summary;
  std::vector<Problem> listed;  // at most kListedProblemLimit
  uint64_t counts[static_cast<size_t>(ProblemKind::Count)] = {};

  uint64_t problemCount() const;
  bool ok() const { return fatal.empty() && problemCount() == 0; }
  void add(ProblemKind kind, std::string text);
};

// `root`: canonical absolute path of the image.
VerifyResult verifyImage(const std::string& root);

// The report: summary, problem counts, the listed problems, a verdict line.
void printVerifyResult(const std::string& root, const VerifyResult& result, FILE* out);
// The same as one JSON document (verify --json).
std::string verifyResultJSON(const std::string& root, const VerifyResult& result);

}  // namespace devicegen
