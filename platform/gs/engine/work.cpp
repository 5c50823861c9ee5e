#include "engine/work.h"

namespace gs {
namespace {

constexpr std::size_t kBytesOfUnit = 4096;

std::size_t size_of(const SharedBytes& bytes) { return bytes ? bytes->size() : 0; }
std::size_t size_of(const SharedMembership& ids) { return ids ? ids->size() * sizeof(ProviderId) : 0; }
std::size_t size_of(const SharedLeaveCodes& codes) { return codes ? codes->size() * sizeof(LeaveCode) : 0; }
std::size_t size_of(const SharedVoteResults& results) {
  if (!results) return 0;
  std::size_t bytes = results->size() * sizeof(VoteResult);
  for (const VoteResult& r : *results) bytes += size_of(r.proposed_state) + size_of(r.message);
  return bytes;
}

std::size_t size_of(const ProtocolNotification& n) {
  const Proposal& p = n.proposal;
  return size_of(p.current_providers) + size_of(p.changing_providers) + size_of(p.leave_codes) +
         size_of(p.current_state) + size_of(p.proposed_state) + size_of(p.message) +
         size_of(p.current_vote_results) + size_of(p.changing_vote_results);
}
std::size_t size_of(const AnnouncementNotification& n) { return size_of(n.providers); }
std::size_t size_of(const SubscriptionNotification& n) {
  return size_of(n.state) + size_of(n.full_membership) + size_of(n.changing_membership) + size_of(n.leave_codes);
}
std::size_t size_of(const DelayedErrorNotification&) { return 0; }

}  // namespace

std::size_t work_of(std::span<const Delivery> deliveries) {
  const Notification* measured = nullptr;
  std::size_t each = 0, work = 0;
  for (const Delivery& delivery : deliveries) {
    if (delivery.what.get() != measured) {
      measured = delivery.what.get();
      each = 1 + std::visit([](const auto& n) { return size_of(n); }, *measured) / kBytesOfUnit;
    }
    work += each;
  }
  return work;
}

}  // namespace gs
