#pragma once

#include <filesystem>
#include <optional>
#include <string>
#include <vector>

namespace service {

struct Options {
  int port = 0;
  std::filesystem::path data;
  std::optional<std::filesystem::path> record;
  std::optional<std::filesystem::path> bag;
  std::vector<std::string> faults;
};

/// Reads the command line. When the program is to end instead (help, or a bad line, which is explained in one
/// line on stderr), `exitCode` is set: 0 or 2.
struct CommandLine {
  Options options;
  std::optional<int> exitCode;
};
CommandLine readCommandLine(int argc, char** argv);

}  // namespace service
