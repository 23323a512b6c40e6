// `brisvalectl alert-agent`: shows the daemon's user alerts on a terminal and answers
// them when Enter is pressed, or by itself after a delay.
#pragma once

#include <optional>
#include <string>

namespace brisvale::tools {

struct AlertAgentOptions {
  std::string socketPath;
  std::optional<int> autoDismissSeconds;
  bool json = false;  // one JSON object a line instead of text
};

// Serves until interrupted; returns an exit status only when the socket cannot be served.
int RunAlertAgent(const AlertAgentOptions& options);

}  // namespace brisvale::tools
