// gsctl set and gsctl send: propose a state value, or a message, to a group.
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "tools/gsctl/propose.h"

namespace gsctl {
namespace {

struct Options {
  Proposal proposal;
  std::string value;  // "-": standard input
};

/// All of it, or one byte more than may be sent.
std::string standard_input(std::size_t limit) {
  std::string bytes;
  while (bytes.size() <= limit) {
    const std::size_t before = bytes.size();
    bytes.resize(limit + 1);
    const ssize_t got = read(STDIN_FILENO, bytes.data() + before, bytes.size() - before);
    if (got < 0 && errno != EINTR) {
      throw Error(kRefused, std::string("cannot read standard input: ") + strerror(errno));
    }
    bytes.resize(before + static_cast<std::size_t>(std::max<ssize_t>(got, 0)));
    if (got == 0) break;
  }
  return bytes;
}

std::string value_of(const Options& options, int wyx_limits::*length) {
  wyx_limits limits{};
  zelt_gscl_V1::GSController::getLimits(&limits);
  const auto limit = static_cast<std::size_t>(limits.*length);
  std::string value = options.value == "-" ? standard_input(limit) : options.value;
  if (value.size() > limit) {
    throw Error(kWrongUse,
                "over the limit of " + std::to_string(limit) + " bytes: keep it elsewhere, and where it is here");
  }
  return value;
}

int set(const Options& options, const Settings& settings) {
  const std::string value = value_of(options, &wyx_limits::max_state_value_length);
  return propose(options.proposal, settings, [&](Member& member) {
    return member.changeStateValue(record_of<wyx_state_value_t>(value), WYX_N_PHASE, options.proposal.vote_time);
  });
}

int send(const Options& options, const Settings& settings) {
  const std::string text = value_of(options, &wyx_limits::max_provider_message_length);
  return propose(options.proposal, settings, [&](Member& member) {
    return member.send_message(record_of<wyx_provider_message_t>(text), WYX_N_PHASE, options.proposal.vote_time);
  });
}

Run add(CLI::App& command, const char* argument, const char* help, int (*run)(const Options&, const Settings&)) {
  auto options = std::make_shared<Options>();
  add_proposal_options(command, options->proposal);
  command.add_option(argument, options->value, help)->type_name("")->required();
  return [options, run](const Settings& settings) { return run(*options, settings); };
}

}  // namespace

Run add_set(CLI::App& command) {
  return add(command, "VALUE", "The new value; -: standard input, any bytes", set);
}

Run add_send(CLI::App& command) { return add(command, "TEXT", "The message; -: standard input, any bytes", send); }

}  // namespace gsctl
