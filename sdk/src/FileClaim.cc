#include "storix/FileClaim.h"

#include <cerrno>
#include <utility>

#include "sdk/src/Claims.h"

namespace storix {

using sdk::Claim;

namespace {

/// Whether the claim was held, and is the caller's to end from now on.
bool beginToEnd(Claim &claim) {
  auto held = Claim::State::held;
  return claim.state.compare_exchange_strong(held, Claim::State::ending);
}

}  // namespace

FileClaim::FileClaim() = default;
FileClaim::FileClaim(std::shared_ptr<Claim> claim) : claim_(std::move(claim)) {}
FileClaim::FileClaim(FileClaim &&other) noexcept = default;

FileClaim &FileClaim::operator=(FileClaim &&other) noexcept {
  FileClaim taken(std::move(other));
  claim_.swap(taken.claim_);
  return *this;
}

FileClaim::~FileClaim() {
  if (claim_ && beginToEnd(*claim_)) (void)claim_->claims()->end(claim_, {});
}

bool FileClaim::isHeld() const { return claim_ && claim_->state == Claim::State::held; }

bool FileClaim::lost() const { return claim_ && claim_->state == Claim::State::lost; }

std::optional<SXError> FileClaim::end() {
  if (!claim_ || !beginToEnd(*claim_)) return lost() ? std::optional(sdk::claimLostError()) : std::nullopt;
  const auto &claims = claim_->claims();
  if (claims->thread().isCurrent()) {
    (void)claims->end(claim_, {});
    return posixError(EDEADLK, "waiting for a claim's end on the thread that would bring it");
  }
  return claims->thread().wait<std::optional<SXError>>([this, &claims](const sdk::Claims::EndHandler &handler) {
    if (!claims->end(claim_, handler)) handler(sdk::claimLostError());
  });
}

}  // namespace storix
