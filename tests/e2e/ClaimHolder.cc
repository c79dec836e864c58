// Claims the file of a URL, says "held" on stderr, and keeps the claim until it is killed.
//
//   e2e_claim_holder read|write URL

#include <unistd.h>

#include <cstdio>
#include <string>

#include "storix/FileCoordinator.h"

int main(int count, char **arguments) {
  if (count != 3) return 2;
  const auto url = storix::URL::fromString(arguments[2]);
  if (!url) return 2;
  storix::FileCoordinator coordinator;
  const auto claim = std::string(arguments[1]) == "write" ? coordinator.write(*url) : coordinator.read(*url);
  if (!claim) {
    std::fprintf(stderr, "%s\n", claim.error().message().c_str());
    return 1;
  }
  std::fprintf(stderr, "held\n");
  for (;;) ::pause();
}
