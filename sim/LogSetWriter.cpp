// SPDX-License-Identifier: MIT
#include "sim/LogSetWriter.h"

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <vector>

#include "halvex/trace/DiagConfig.h"
#include "halvex/trace/LogLocations.h"
#include "platform/ServerProtocol.h"

namespace halvex::sim {
namespace {

namespace fs = std::filesystem;

std::string snapshot(std::string_view timestamp, std::string_view ending) {
  std::string path(trace::kSnapshotFolder);
  path += trace::kLogDirPrefix;
  path += timestamp;
  path += ending;
  return path;
}

std::string_view traceSuffix(std::int64_t vendor) {
  return vendor == 1 ? trace::kQoroTraceSnapshotDirectorySuffix
                     : trace::kVimoTraceSnapshotDirectorySuffix;
}

std::string_view coreDumpSuffix(std::int64_t vendor) {
  return vendor == 1 ? trace::kQoroCoreDumpSnapshotDirectorySuffix
                     : trace::kVimoCoreDumpSnapshotDirectorySuffix;
}

bool writeText(const fs::path& file, const std::string& text) {
  std::ofstream out(file, std::ios::trunc);
  out << text;
  return static_cast<bool>(out.flush());
}

// Fills folder with a few small files that say what they stand for.
bool fillFolder(const fs::path& folder, const std::string& name, std::string_view description) {
  std::error_code error;
  fs::create_directories(folder, error);
  if (error) {
    return false;
  }
  return writeText(folder / "summary.txt",
                   "Simulated log set " + name + "\n" + std::string(description) + "\n") &&
         writeText(folder / "baseband.log", "00:00:00.000 simulated baseband trace\n") &&
         writeText(folder / "telephony.log", "00:00:00.000 simulated telephony log\n");
}

// tar from PATH, with a clean signal mask: the daemon blocks SIGTERM for its event loop.
bool runTar(const std::vector<std::string>& args) {
  std::vector<char*> argv;
  argv.reserve(args.size() + 1);
  for (const auto& arg : args) {
    argv.push_back(const_cast<char*>(arg.c_str()));
  }
  argv.push_back(nullptr);
  const pid_t pid = ::fork();
  if (pid < 0) {
    return false;
  }
  if (pid == 0) {
    sigset_t none;
    ::sigemptyset(&none);
    ::pthread_sigmask(SIG_SETMASK, &none, nullptr);
    ::execvp(argv[0], argv.data());
    ::_exit(127);
  }
  int status = 0;
  while (::waitpid(pid, &status, 0) < 0) {
    if (errno != EINTR) {
      return false;
    }
  }
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

// The package holds one folder named like the package without its extension; it is built in a
// staging folder and renamed into place, so nobody sees half an archive.
bool writePackage(const fs::path& target, std::string_view description) {
  std::string name = target.filename().string();
  name.resize(name.size() - std::string_view(trace::kLogPackageExtension).size());
  const fs::path staging = target.parent_path() / (".staging-" + name);
  std::error_code error;
  fs::remove_all(staging, error);
  const fs::path partial = staging / "package.tar.gz";
  const bool ok = fillFolder(staging / name, name, description) &&
                  runTar({"tar", "-czf", partial.string(), "-C", staging.string(), name});
  if (ok) {
    fs::rename(partial, target, error);
  }
  fs::remove_all(staging, error);
  return ok && !error;
}

}  // namespace

std::optional<LogSet> logSetForDump(const MessageDict& request, std::string_view timestamp,
                                    std::int64_t vendor) {
  const std::string action = request.getString(kKeyTraceAction);
  const MessageValue* flag = request.get(kKeyTraceDumpStatePerformCompression);
  const bool compression = flag != nullptr && flag->asBool() != nullptr && *flag->asBool();
  const std::string pattern = snapshot(timestamp, "-*");
  const std::string package = snapshot(timestamp, trace::kLogPackageExtension);
  if (action == kCollectTelephonyLogs) {
    if (compression) {
      return LogSet{package, package, true};
    }
    return LogSet{pattern, snapshot(timestamp, kTelephonySuffix), false};
  }
  if (action == kCollectTelephonyLogsWithCoredump) {
    // The tool prints the pattern either way; a compressed set still has to match it.
    const std::string folder = snapshot(timestamp, coreDumpSuffix(vendor));
    if (compression) {
      return LogSet{pattern, folder + trace::kLogPackageExtension, true};
    }
    return LogSet{pattern, folder, false};
  }
  if (action == kCollectBasebandLogs) {
    if (compression) {
      return LogSet{package, package, true};
    }
    const std::string folder = snapshot(timestamp, traceSuffix(vendor));
    return LogSet{folder, folder, false};
  }
  return std::nullopt;
}

LogSet logSetForHelper(std::string_view timestamp, std::int64_t vendor) {
  const std::string folder = snapshot(timestamp, traceSuffix(vendor));
  return LogSet{folder, folder, false};
}

LogSetWriter::LogSetWriter(std::string root) : root_(std::move(root)) {}

bool LogSetWriter::prepare() const {
  if (root_.empty()) {
    return true;
  }
  const fs::path scratch = fs::path(root_ + trace::kScratchFolder) / diag::config::kDIAGScratchDir;
  if (!fillFolder(scratch, diag::config::kDIAGScratchDir, "Live baseband logs")) {
    std::fprintf(stderr, "halvex-sim: cannot create %s\n", scratch.c_str());
    return false;
  }
  return true;
}

bool LogSetWriter::write(const LogSet& set, std::string_view description) const {
  if (root_.empty()) {
    return true;
  }
  const fs::path target = root_ + set.written;
  const std::string name = target.filename().string();
  // The time stamp comes from the scenario; it must stay one file name inside the snapshot folder.
  if (target.parent_path() != fs::path(root_ + trace::kSnapshotFolder).parent_path() ||
      name == "." || name == "..") {
    std::fprintf(stderr, "halvex-sim: not writing %s: the time stamp is not a plain name\n",
                 set.written.c_str());
    return false;
  }
  std::error_code error;
  if (fs::exists(target, error)) {
    return true;
  }
  fs::create_directories(target.parent_path(), error);
  const bool ok = !error && (set.package ? writePackage(target, description)
                                         : fillFolder(target, name, description));
  if (!ok) {
    std::fprintf(stderr, "halvex-sim: cannot write %s\n", target.c_str());
  }
  return ok;
}

}  // namespace halvex::sim
