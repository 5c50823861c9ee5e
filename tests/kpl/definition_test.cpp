// Definition files and control packets, by themselves.
#include "master/definition.h"

#include <sys/stat.h>

#include <fstream>

#include "control/control.h"
#include "support/temp_dir.h"

namespace kpl {
namespace {

using testing::HasSubstr;

TEST(DefinitionFile, Mistakes_AreToldWithTheirLine) {
  const test_support::TempDir dir;
  const auto problem_of = [&](const std::string& content) -> std::string {
    std::ofstream(dir / "x.toml") << content;
    try {
      master::read_definition(dir / "x.toml");
    } catch (const platform::SettingError& error) {
      return error.what();
    }
    return "none";
  };
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
      {"group = '\xff'", "x.toml:3: is no UTF-8 text"},
      {"environment = { \"A B\" = \"x\" }", "x.toml:3: environment: names are made of letters"},
      {"pass-environment = [\"KPL_SUBSYSTEM\"]", "pass-environment: 'KPL_SUBSYSTEM' is set by kplmstr"},
      {"ping-limit = 1", "x.toml:3: ping-limit: needs a 'ping-interval' too"},
      {"ping-interval = 1\ntransport = \"signals\"", "x.toml:3: ping-interval: signals carry no pings"},
      {"restart-delay-max = 86400\nuser = \"\xc3\xa9\"", "none"},
  };
  for (const auto& [line, problem] : lines) EXPECT_THAT(problem_of(good + line + "\n"), HasSubstr(problem));
  EXPECT_THAT(problem_of("name = \"x\"\n"), HasSubstr("x.toml: 'program' is missing"));
  EXPECT_THAT(problem_of("program = \"/x\"\n"), HasSubstr("x.toml: 'name' is missing"));
  EXPECT_THAT(problem_of("name = \"" + std::string(30, 'n') + "\"\n"),
              HasSubstr("x.toml:1: name: must be 1 to 29"));

  const std::string queue = "program = \"/x\"\ntransport = \"queue\"\nqueue-key = 5\n";
  std::ofstream(dir / "x.toml") << "name = \"x\"\n" + queue;
  std::ofstream(dir / "y.toml") << "name = \"y\"\n" + queue;
  const auto folder = master::read_folder(dir / "");
  chmod((dir / "x.toml").c_str(), 0646);  // what others could change would run as root
  EXPECT_THAT(master::read_folder(dir / "").skipped.at(0).problem, HasSubstr("x.toml: can be written by others"));
  chmod((dir / "").c_str(), 0777);
  EXPECT_THROW(master::read_folder(dir / ""), platform::SettingError);
  ASSERT_EQ(folder.skipped.size(), 1u);
  EXPECT_THAT(folder.skipped[0].problem, HasSubstr("y.toml: queue-key: 5 is taken by "));
}

TEST(ControlPacket, WhatMakesNoSense_IsMalformed) {
  for (const char* packet :
       {"", "{", "null", "{}", "{\"end\":1}", "{\"end\":\"fine\"}", "{\"lines\":{}}", "{\"lines\":[[\"a\"]]}",
        "{\"lines\":[[1,2]]}", "{\"wait\":\"x\"}", "{\"message\":2}", "{\"entry\":{\"a\":[[[[[[[[]]]]]]]]}}",
        "{\"entry\":[]}", "{\"end\":\"ok\",\"code\":1e9}"}) {
    EXPECT_THROW(control::decode_answer(packet), control::Malformed) << packet;
  }
  for (const char* packet :
       {"{\"action\":1}", "{\"action\":\"stop\",\"stop\":\"dead\"}", "{\"action\":\"list\",\"long\":1}",
        "{\"action\":\"request\",\"code\":18446744073709551615}", "{\"action\":\"request\",\"parm1\":-32769}",
        "{\"action\":\"start\",\"subsystem\":[]}"}) {
    EXPECT_THROW(control::decode_request(packet), control::Malformed) << packet;
  }
}

}  // namespace
}  // namespace kpl
