// Carries a devicegen image into the new layout by hand, through the real
// registry, the way a migration would: each application installed (a
// placeholder bundle as a placeholder), its user data moved into the data
// container the registry assigns, group containers emptied into the new
// ones, safe harbors registered, the old layout removed and the system
// version recorded. The verifier's tests start from such a tree and then
// damage it.
#pragma once

#include <string>

namespace tooltest {

// "" on success, otherwise what failed.
std::string simulateMigration(const std::string& root);

}  // namespace tooltest
