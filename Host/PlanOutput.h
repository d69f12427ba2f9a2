// How transvale shows a plan (--plan): text for people, or one JSON document
// (--json) with the same content. See docs/transvale.md for both.
//
// Thread safety: pure functions.
#pragma once

#include <string>

#include "Platform/Host/MigrationPlan.h"

namespace transvale {

std::string planText(const platform::MigrationPlan& plan);
std::string planJSON(const platform::MigrationPlan& plan);

// The words for an action and a discard, as both forms show them.
const char* actionName(platform::PlannedAction action);
const char* discardName(platform::PlannedDiscardKind kind);

}  // namespace transvale
