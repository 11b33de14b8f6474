// How long kestrel-run takes from its start to the first instruction of the
// program it starts, against bwrap started directly with the same command
// line (what kestrel-run --print-command gives) in the same run, the two
// alternating. The program prints the monotonic clock as it starts; the
// clock is read here just before the fork. --also runs another kestrel-run
// binary (an earlier build, say) with the same arguments in the same rounds.
//
//   kestrel_launch_bench --rounds N [--also KESTREL-RUN] -- KESTREL-RUN-COMMAND... -- STAMP
#include <fcntl.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <iostream>
#include <sstream>
#include <string>
#include <vector>

namespace {

long long monotonicNow() {
  timespec now{};
  ::clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<long long>(now.tv_sec) * 1000000000LL + now.tv_nsec;
}

// Runs the command; its standard output, or nothing when it failed.
bool runCommand(const std::vector<std::string>& command, std::string* output,
                long long* startedAt) {
  int pipeFds[2];
  if (::pipe2(pipeFds, O_CLOEXEC) != 0) return false;
  std::vector<char*> arguments;
  for (const std::string& argument : command)
    arguments.push_back(const_cast<char*>(argument.c_str()));
  arguments.push_back(nullptr);
  *startedAt = monotonicNow();
  const pid_t child = ::fork();
  if (child == 0) {
    ::dup2(pipeFds[1], STDOUT_FILENO);
    ::execvp(arguments[0], arguments.data());
    ::_exit(127);
  }
  ::close(pipeFds[1]);
  output->clear();
  char buffer[256];
  for (ssize_t got; (got = ::read(pipeFds[0], buffer, sizeof buffer)) > 0;)
    output->append(buffer, got);
  ::close(pipeFds[0]);
  int status = 0;
  ::waitpid(child, &status, 0);
  return child > 0 && WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

double percentile(std::vector<double> values, double p) {
  std::sort(values.begin(), values.end());
  return values[static_cast<std::size_t>(p * (values.size() - 1))];
}

}  // namespace

int main(int argc, char** argv) {
  int rounds = 200;
  std::string also;
  std::vector<std::string> launcher;
  int i = 1;
  for (; i < argc && std::strcmp(argv[i], "--") != 0; ++i) {
    if (std::strcmp(argv[i], "--rounds") == 0 && i + 1 < argc) rounds = std::atoi(argv[++i]);
    if (std::strcmp(argv[i], "--also") == 0 && i + 1 < argc) also = argv[++i];
  }
  for (++i; i < argc; ++i) launcher.push_back(argv[i]);
  const auto separator = std::find(launcher.begin(), launcher.end(), "--");
  if (launcher.empty() || separator == launcher.end() || rounds < 1) {
    std::cerr << "usage: kestrel_launch_bench [--rounds N] -- KESTREL-RUN... -- STAMP\n";
    return 2;
  }
  // The same launch by bwrap alone: kestrel-run's own command line for it.
  std::vector<std::string> printing(launcher.begin(), separator);
  printing.push_back("--print-command");
  printing.insert(printing.end(), separator, launcher.end());
  std::string printed;
  long long ignored = 0;
  if (!runCommand(printing, &printed, &ignored)) {
    std::cerr << "kestrel-run --print-command failed\n";
    return 1;
  }
  std::vector<std::string> direct;
  std::istringstream lines(printed);
  for (std::string line; std::getline(lines, line);) direct.push_back(line);

  std::vector<std::string> other = launcher;
  if (!also.empty()) other[0] = also;
  std::vector<double> viaLauncher, viaBwrap, viaOther;
  std::vector<std::pair<std::vector<double>*, const std::vector<std::string>*>> phases = {
      {&viaLauncher, &launcher}, {&viaBwrap, &direct}};
  if (!also.empty()) phases.emplace_back(&viaOther, &other);
  for (int round = -5; round < rounds; ++round) {  // five rounds of warming up
    for (const auto& [samples, command] : phases) {
      std::string output;
      long long startedAt = 0;
      if (!runCommand(*command, &output, &startedAt)) {
        std::cerr << "a launch failed\n";
        return 1;
      }
      if (round >= 0) samples->push_back((std::atoll(output.c_str()) - startedAt) / 1000.0);
    }
  }
  std::printf("launch to first instruction, %d alternating rounds (µs)\n", rounds);
  std::printf("%-12s %10s %10s\n", "", "p50", "p90");
  std::printf("%-12s %10.0f %10.0f\n", "kestrel-run", percentile(viaLauncher, 0.5),
              percentile(viaLauncher, 0.9));
  std::printf("%-12s %10.0f %10.0f\n", "bwrap", percentile(viaBwrap, 0.5),
              percentile(viaBwrap, 0.9));
  std::printf("ratio p50 %.2fx, p90 %.2fx\n",
              percentile(viaLauncher, 0.5) / percentile(viaBwrap, 0.5),
              percentile(viaLauncher, 0.9) / percentile(viaBwrap, 0.9));
  if (!also.empty()) {
    std::printf("%-12s %10.0f %10.0f  (%s)\n", "also", percentile(viaOther, 0.5),
                percentile(viaOther, 0.9), also.c_str());
    std::printf("also: ratio p50 %.2fx, p90 %.2fx\n",
                percentile(viaOther, 0.5) / percentile(viaBwrap, 0.5),
                percentile(viaOther, 0.9) / percentile(viaBwrap, 0.9));
  }
  return 0;
}
