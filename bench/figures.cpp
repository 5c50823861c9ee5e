#include "bench/figures.h"

#include <sys/utsname.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <thread>

namespace zn {
namespace {

std::string processor() {
  std::ifstream info("/proc/cpuinfo");
  for (std::string line; std::getline(info, line);) {
    if (line.rfind("model name", 0) == 0) return line.substr(line.find(':') + 2);
  }
  return "unknown processor";
}

std::string verdict(const Figure& figure) {
  if (!figure.failed.empty()) return "FAILED: " + figure.failed;
  if (!figure.at_most) return "";
  return figure.measured <= *figure.at_most ? "met" : "MISSED";
}

}  // namespace

void print_host() {
  utsname system{};
  ::uname(&system);
  double load = 0;
  std::ifstream("/proc/loadavg") >> load;
  std::printf("host: %s, %u threads, %s %s, load %.1f\n", processor().c_str(), std::thread::hardware_concurrency(),
              system.sysname, system.release, load);
  std::printf("compiler: %s\n", __VERSION__);
}

void Figures::print() const {
  std::printf("\n%-66s %12s  %-18s %9s\n", "figure", "measured", "", "at most");
  for (const Figure& f : figures_) {
    std::printf("%-66s %12.2f  %-18s ", f.name.c_str(), f.measured, f.unit.c_str());
    if (f.at_most) std::printf("%9.2f  %s", *f.at_most, verdict(f).c_str());
    std::printf("\n");
  }
}

bool Figures::write_json(const std::string& path) const {
  if (path.empty()) return true;
  std::ofstream out(path);
  out << "{\"figures\": [";
  const char* separator = "\n";
  for (const Figure& f : figures_) {
    out << separator << "  {\"name\": \"" << f.name << "\", \"measured\": " << f.measured << ", \"unit\": \""
        << f.unit << '"';
    if (f.at_most) out << ", \"at_most\": " << *f.at_most << ", \"verdict\": \"" << verdict(f) << '"';
    out << '}';
    separator = ",\n";
  }
  out << "\n]}\n";
  return static_cast<bool>(out.flush());
}

std::string option(int argc, char** argv, const std::string& name) {
  const std::string prefix = "--" + name + "=";
  for (int i = 1; i < argc; i++) {
    const std::string word = argv[i];
    if (word.rfind(prefix, 0) == 0) return word.substr(prefix.size());
  }
  return "";
}

bool flag(int argc, char** argv, const std::string& name) {
  return std::any_of(argv + 1, argv + argc, [&](const char* word) { return word == "--" + name; });
}

double percentile(std::vector<double>& samples, double share) {
  if (samples.empty()) return 0;
  std::sort(samples.begin(), samples.end());
  return samples[std::min(samples.size() - 1, static_cast<size_t>(share * static_cast<double>(samples.size())))];
}

double resident_kib(pid_t process) {
  std::ifstream status("/proc/" + std::to_string(process) + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.rfind("VmRSS:", 0) == 0) return std::atof(line.c_str() + 6);
  }
  return 0;
}

}  // namespace zn
