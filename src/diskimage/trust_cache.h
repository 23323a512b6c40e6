// Handing the trust cache an image carries to the code-integrity service.
#pragma once

#include <string_view>

namespace brisvale {

// Loads mountPath + "/.TrustCache" into the code-integrity service. 0 when loaded or
// when the image has none; -1 when it could not be read or the service refused it.
int LoadTrustCache(std::string_view mountPath);

}  // namespace brisvale
