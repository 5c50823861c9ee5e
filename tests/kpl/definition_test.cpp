// Definition files and control packets, by themselves.
#include "master/definition.h"

#include <fstream>

#include "control/control.h"
#include "support/temp_dir.h"

namespace kpl {
namespace {

using testing::HasSubstr;

class DefinitionFile : public testing::Test {
 protected:
  master::Definition read(const std::string& content) {
    std::ofstream(file_) << content;
    return master::read_definition(file_);
  }
  /// What is said of `content`, without the folder.
  std::string problem_of(const std::string& content) {
    try {
      read(content);
    } catch (const platform::SettingError& error) {
      return std::string(error.what()).substr(file_.size() - strlen("x.toml"));
    }
    return "none";
  }

  test_support::TempDir dir_;
  const std::string file_ = dir_ / "x.toml";
};

TEST_F(DefinitionFile, Settings_AreAllTaken) {
  const auto d = read(R"(
name = "a.b_c-1"
group = "g"
program = "/bin/x"
arguments = ["1", ""]
user = "daemon"
output = "/var/log/x"
autostart = true
restart = true
transport = "queue"
queue-key = 0x7fffffff
queue-type = 9
request-time = 0.5
stop-time = 3
restart-delay = 0.25
restart-delay-max = 86400
)");
  EXPECT_EQ(d.name, "a.b_c-1");
  EXPECT_EQ(d.group, "g");
  EXPECT_EQ(d.arguments, (std::vector<std::string>{"1", ""}));
  EXPECT_EQ(d.user, "daemon");
  EXPECT_EQ(d.output, "/var/log/x");
  EXPECT_TRUE(d.autostart && d.restart);
  EXPECT_EQ(d.transport, master::Transport::kQueue);
  EXPECT_EQ(d.queue_key, 0x7fffffff);
  EXPECT_EQ(d.queue_type, 9);
  EXPECT_EQ(d.request_time.count(), 500);
  EXPECT_EQ(d.stop_time.count(), 3000);
  EXPECT_EQ(d.restart_delay.count(), 250);
  EXPECT_EQ(d.restart_delay_max.count(), 86'400'000);
}

TEST_F(DefinitionFile, Mistakes_AreToldWithTheirLine) {
  const std::string good = "name = \"x\"\nprogram = \"/x\"\n";
  const char* const lines[][2] = {
      {"colour = 1", "x.toml:3: unknown setting 'colour'"},
      {"group = 1", "x.toml:3: group: must be a text in quotes"},
      {"group = \"a b\"", "x.toml:3: group: must be 1 to 29 letters"},
      {"arguments = \"x\"", "x.toml:3: arguments: must be a list"},
      {"arguments = [1]", "x.toml:3: arguments: each must be a text"},
      {"output = \"relative\"", "x.toml:3: output: must be a path that begins with '/'"},
      {"restart = 1", "x.toml:3: restart: must be true or false"},
      {"stop-time = 0", "x.toml:3: stop-time: must be 0.001 to 86400 seconds"},
      {"stop-time = nan", "x.toml:3: stop-time: must be 0.001 to 86400 seconds"},
      {"transport = \"pigeon\"", "x.toml:3: transport: must be \"socket\""},
      {"transport = \"queue\"", "x.toml:3: transport: a queue needs a 'queue-key' too"},
      {"queue-key = 5", "x.toml:3: queue-key: is for transport = \"queue\" only"},
      {"normal-signal = \"SIGUSR1\"", "x.toml:3: normal-signal: is for transport = \"signals\" only"},
      {"transport = \"signals\"\nforced-signal = \"SIGRTMIN\"", "x.toml:4: forced-signal: must be the name"},
  };
  for (const auto& [line, problem] : lines) EXPECT_THAT(problem_of(good + line + "\n"), HasSubstr(problem));
  EXPECT_EQ(problem_of("name = \"x\"\n"), "x.toml: 'program' is missing");
  EXPECT_EQ(problem_of("program = \"/x\"\n"), "x.toml: 'name' is missing");
  EXPECT_THAT(problem_of("name = \"" + std::string(30, 'n') + "\"\n"),
              HasSubstr("x.toml:1: name: must be 1 to 29"));
}

TEST(ControlPacket, Messages_SurviveTheWay) {
  control::Request request{
      control::Action::kRequest, "s", control::StopKind::kCancel, true, true, 300, -1, 2, "d\"\n"};
  const auto again = control::decode_request(control::encode(request));
  EXPECT_EQ(again.subsystem, "s");
  EXPECT_EQ(again.code, 300);
  EXPECT_EQ(again.parm1, -1);
  EXPECT_EQ(again.data, "d\"\n");
  EXPECT_TRUE(again.long_form);

  const auto lines = control::decode_answer(control::encode(control::Lines{{{"m", "b\xff"}}}));
  EXPECT_EQ(std::get<control::Lines>(lines).lines.at(0).body, "b\xef\xbf\xbd");
  const auto end = control::decode_answer(control::encode(control::End{control::Result::kNoAnswer, -1, "t"}));
  EXPECT_EQ(std::get<control::End>(end).result, control::Result::kNoAnswer);
  EXPECT_EQ(std::get<control::End>(end).code, -1);
}

TEST(ControlPacket, WhatMakesNoSense_IsMalformed) {
  for (const char* packet : {"", "{", "null", "{}", "{\"end\":1}", "{\"end\":\"fine\"}", "{\"lines\":{}}",
                             "{\"lines\":[[\"a\"]]}", "{\"lines\":[[1,2]]}", "{\"wait\":\"x\"}", "{\"message\":2}",
                             "{\"entry\":[]}", "{\"end\":\"ok\",\"code\":1e9}"}) {
    EXPECT_THROW(control::decode_answer(packet), control::Malformed) << packet;
  }
  for (const char* packet :
       {"{\"action\":1}", "{\"action\":\"stop\",\"stop\":\"dead\"}", "{\"action\":\"list\",\"long\":1}",
        "{\"action\":\"request\",\"code\":18446744073709551615}", "{\"action\":\"request\",\"parm1\":-32769}",
        "{\"action\":\"start\",\"subsystem\":[]}"}) {
    EXPECT_THROW(control::decode_request(packet), control::Malformed) << packet;
  }
  control::Request request;
  request.action = control::Action::kRequest;
  request.data = "\xff";
  EXPECT_THROW(control::encode(request), control::Malformed);
}

}  // namespace
}  // namespace kpl
