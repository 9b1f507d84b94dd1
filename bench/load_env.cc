// The load program's private world: a temporary folder, plug-in bundles and
// SDK dictionaries on disk, and drd processes started in it.
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "bench/load.h"
#include "pdoc/pdoc.h"

namespace drbench {

using dr::Array;
using dr::Value;

void Die(const std::string& message) {
  std::fprintf(stderr, "load: %s\n", message.c_str());
  std::exit(1);
}

double Micros(Clock::time_point from, Clock::time_point to) {
  return std::chrono::duration<double, std::micro>(to - from).count();
}

double Samples::quantile(double p) const {
  if (micros.empty()) return 0;
  std::vector<double> sorted = micros;
  std::sort(sorted.begin(), sorted.end());
  size_t rank = static_cast<size_t>(std::ceil(p * static_cast<double>(sorted.size())));
  return sorted[std::clamp<size_t>(rank, 1, sorted.size()) - 1];
}

TempRoot::TempRoot() {
  char pattern[] = "/tmp/drd-bench.XXXXXX";
  if (::mkdtemp(pattern) == nullptr) Die("cannot make a temporary folder");
  path_ = std::filesystem::canonical(pattern).string();
}

TempRoot::~TempRoot() {
  if (keep) {
    std::fprintf(stderr, "load: kept %s\n", path_.c_str());
    return;
  }
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

void WriteFile(const std::string& path, const std::string& bytes) {
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
  if (!out.good()) Die("cannot write " + path);
}

void WritePdoc(const std::string& path, const Value& value) {
  dr::Result<std::string> xml = dr::pdoc::WriteXml(value);
  if (!xml.ok()) Die("cannot encode " + path);
  WriteFile(path, *xml);
}

std::string PointName(int point) { return "org.bench.point" + std::to_string(point); }

BundleSet MakeBundles(const std::string& folder, const std::string& sdkFolder, int apps, int points,
                      int perPoint) {
  const Value entitlements{{"com.corvel.security.app-sandbox", true}};
  BundleSet set;
  set.points = points;
  set.perPoint = perPoint;
  for (int a = 0; a < apps; ++a) {
    const std::string app = folder + "/App" + std::to_string(a) + ".app";
    WritePdoc(app + "/Contents/Info.pdoc",
              Value{{"BNBundleIdentifier", "org.bench.app" + std::to_string(a)},
                    {"BNBundleDisplayName", "Bench App " + std::to_string(a)}});
  }
  for (int p = 0; p < points; ++p) {
    const std::string sdk = sdkFolder + "/" + PointName(p) + ".pdoc";
    if (!std::filesystem::exists(sdk)) {
      WritePdoc(sdk, Value{{"UXExtension", Value{{"UXExtensionAttributes",
                                                  Value{{"UXExtensionPointName", PointName(p)}}},
                                                 {"CleanTimeout", 30}}}});
    }
    for (int i = 0; i < perPoint; ++i) {
      const int a = i % apps;
      const std::string id =
          "org.bench.app" + std::to_string(a) + ".p" + std::to_string(p) + "." + std::to_string(i);
      const std::string bundle = folder + "/App" + std::to_string(a) + ".app/Contents/PlugIns/P" +
                                 std::to_string(p) + "_" + std::to_string(i) + ".appex";
      Value info{
          {"BNBundleIdentifier", id},
          {"BNBundleVersion", "1." + std::to_string(i % 7) + "." + std::to_string(i)},
          {"BNBundleName", "Plug-in " + std::to_string(p) + "/" + std::to_string(i)},
          {"BNBundleExecutable", "plugin"},
          {"UXExtension",
           Value{{"UXExtensionPointIdentifier", PointName(p)},
                 {"UXExtensionAttributes",
                  Value{{"ActivationRule", Value{{"image/png", 4}, {"text/plain", 1}}},
                        {"org.bench.tags", Value(Array{"fast", "color", "batch"})}}}}},
      };
      WritePdoc(bundle + "/Contents/Info.pdoc", info);
      WritePdoc(bundle + "/Contents/Entitlements.pdoc", entitlements);
      WriteFile(bundle + "/Contents/Exec/plugin", "#!/bin/sh\n");
      set.plugIns.push_back(bundle);
    }
  }
  return set;
}

Drd::Drd(std::string binary, std::string home, std::string sdkFolder)
    : binary_(std::move(binary)), home_(std::move(home)), sdkFolder_(std::move(sdkFolder)) {
  std::filesystem::create_directories(home_);
}

Drd::~Drd() {
  if (pid_ > 0) {
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
  }
}

Clock::time_point Drd::start() {
  std::vector<std::string> environment = {
      "DR_SOCKET_DIR=" + home_ + "/sockets",
      "DR_REGISTRY=" + home_ + "/registry/r.sqlite3",
      "XDG_STATE_HOME=" + home_ + "/state",
      "XDG_CONFIG_HOME=" + home_ + "/config",
      "XDG_DATA_HOME=" + home_ + "/data",
      "DR_NOTIFY_DIR=" + home_ + "/notify",
      "DR_USAGE_LOG=" + home_ + "/usage.log",
      "DR_SDK_PATH=" + sdkFolder_,
      "HOME=" + home_,
      // Nothing installed on the machine joins in.
      "DR_PLUGIN_PATH=" + pluginPath,
  };
  const std::string log = home_ + "/drd.log";
  std::vector<char*> argv{binary_.data(), nullptr};
  std::vector<char*> envp;
  for (std::string& e : environment) envp.push_back(e.data());
  envp.push_back(nullptr);
  const Clock::time_point before = Clock::now();
  pid_ = ::fork();
  if (pid_ < 0) Die("fork failed");
  if (pid_ == 0) {
    int fd = ::open(log.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
    if (fd >= 0) ::dup2(fd, STDERR_FILENO);
    ::execve(binary_.c_str(), argv.data(), envp.data());
    ::_exit(127);
  }
  return before;
}

void Drd::waitUntilServing() {
  const std::string path = socketFolder() + "/com.corvel.dromon.drd";
  const Clock::time_point deadline = Clock::now() + std::chrono::seconds(10);
  while (Clock::now() < deadline) {
    int status = 0;
    if (::waitpid(pid_, &status, WNOHANG) == pid_) {
      pid_ = -1;
      Die("drd exited at start (see " + home_ + "/drd.log)");
    }
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    struct sockaddr_un addr = {};
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
    bool up = ::connect(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) == 0;
    ::close(fd);
    if (up) return;
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  Die("drd did not serve within 10 s");
}

void Drd::stop() {
  if (pid_ <= 0) return;
  ::kill(pid_, SIGTERM);
  const Clock::time_point deadline = Clock::now() + std::chrono::seconds(10);
  while (Clock::now() < deadline) {
    if (::waitpid(pid_, nullptr, WNOHANG) == pid_) {
      pid_ = -1;
      return;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  ::kill(pid_, SIGKILL);
  ::waitpid(pid_, nullptr, 0);
  pid_ = -1;
}

long Drd::statusField(const char* name) const {
  std::ifstream in("/proc/" + std::to_string(pid_) + "/status");
  std::string line;
  const std::string prefix = std::string(name) + ":";
  while (std::getline(in, line)) {
    if (line.rfind(prefix, 0) == 0) return std::strtol(line.c_str() + prefix.size(), nullptr, 10);
  }
  return 0;
}

double Drd::cpuSeconds() const {
  // The run time of each thread in nanoseconds (the first field of its
  // schedstat): finer than the process's clock ticks. A thread that ends
  // takes its time along, so a window over which this is read must not end
  // a connection.
  double ns = 0;
  std::error_code ec;
  for (const auto& task :
       std::filesystem::directory_iterator("/proc/" + std::to_string(pid_) + "/task", ec)) {
    std::ifstream in(task.path() / "schedstat");
    double run = 0;
    if (in >> run) ns += run;
  }
  return ns / 1e9;
}

int Drd::reconciles() const {
  std::ifstream in(home_ + "/drd.log");
  std::string line;
  int n = 0;
  while (std::getline(in, line)) n += line.find(" reconciled in ") != std::string::npos;
  return n;
}

long Drd::peakResidentKiB() const { return statusField("VmHWM"); }
long Drd::residentKiB() const { return statusField("VmRSS"); }

}  // namespace drbench
