// gsctl expel: propose that members are put out of a group.
#include "tools/gsctl/propose.h"
#include "tools/gsctl/text.h"

namespace gsctl {
namespace {

struct Options {
  Proposal proposal;
  std::vector<std::string> ids;
};

int expel(const Options& options, const Settings& settings) {
  for (const std::string& text : options.ids) id_from(text, 0);  // before anything is asked of the group
  Members members;
  return propose(options.proposal, settings, [&](Member& proposer) {
    members.clear();
    for (const std::string& text : options.ids) members.push_back(id_from(text, Session::node()));
    wyx_expel_request_t request{};
    request.gs_num_phases = WYX_N_PHASE;
    request.gs_time_limit = options.proposal.vote_time;
    request.gs_expel_list = {static_cast<unsigned>(members.size()), members.data()};
    return proposer.expelMembers(&request);
  });
}

}  // namespace

Run add_expel(CLI::App& command) {
  auto options = std::make_shared<Options>();
  add_proposal_options(command, options->proposal);
  command.add_option("ID", options->ids, "INSTANCE/NODE, or INSTANCE of this node")->type_name("")->required();
  return [options](const Settings& settings) { return expel(*options, settings); };
}

}  // namespace gsctl
