#include "Shared/Support/QSLog.h"

std::atomic<platform::LogHandle*> gLogHandle{nullptr};

bool QSShouldLog(int level) {
  platform::LogHandle* handle = gLogHandle.load();
  if (level >= kQSLogLevelDebug) return handle && handle->level.load() >= level;
  return !handle || handle->level.load() >= level;
}
