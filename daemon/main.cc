// drd: the per-user plug-in registry daemon.
//
//   drd [-S servicename] [-v]      (daemon/command_line.h; also --help, --version)
//
// Exit status 2 for a bad command line, 1 when the server cannot be built
// (for instance another drd already serves the name), 0 after SIGTERM or
// SIGINT, and for --help and --version. One log line says where drd serves
// and which registry it opened, one that it stopped.
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>

#include "core/log.h"
#include "daemon/command_line.h"
#include "daemon/server.h"
#include "platform/notifications.h"
#include "platform/policy.h"
#include "platform/preferences.h"
#include "platform/sandbox.h"
#include "platform/types.h"
#include "platform/usage_reports.h"
#include "registry/install_folders.h"
#include "registry/registry.h"
#include "registry/service_manager_linux.h"
#include "registry/types_linux.h"
#include "wire/locations.h"

#ifdef DRD_COVERAGE
extern "C" void __gcov_dump(void);
#endif

namespace {

using dr::drd_command_line::kUsage;

struct CommandLine {
  std::string serviceName = dr::DRDServer::kDefaultServiceName;
  std::optional<std::string> annotationFile;  // -d, not in the usage text
  uint32_t verbose = 0;
};

std::optional<CommandLine> ParseCommandLine(int argc, char** argv) {
  CommandLine line;
  opterr = 0;  // the usage text is the only complaint
  for (int c; (c = getopt(argc, argv, "d:S:v")) != -1;) {
    switch (c) {
      case 'd':
        line.annotationFile = optarg;
        break;
      case 'S':
        line.serviceName = optarg;
        break;
      case 'v':
        line.verbose++;
        break;
      default:
        return std::nullopt;
    }
  }
  if (optind != argc) return std::nullopt;
  return line;
}

// Each connection holds a descriptor or two; the soft limit (often 1024)
// would let a few hundred idle peers lock everyone else out, while the hard
// limit is the user's to give.
void RaiseDescriptorLimit() {
  struct rlimit limit;
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur >= limit.rlim_max) return;
  const rlim_t before = limit.rlim_cur;
  limit.rlim_cur = limit.rlim_max;
  if (setrlimit(RLIMIT_NOFILE, &limit) != 0) {
    dr::SystemLog("unable to raise the descriptor limit from %llu: %@",
                  static_cast<unsigned long long>(before), dr::PosixError(errno, "setrlimit"));
  }
}

// --help and --version are answered before getopt sees the command line,
// wherever they stand; anything else keeps the usage text and status 2.
std::optional<int> AnswerHelpOrVersion(int argc, char** argv) {
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--help") == 0) {
      std::string help = std::string(kUsage) + "drd, " + dr::drd_command_line::kSummary + ".\n\n";
      // Each option, its description wrapped at 79 columns beside it.
      constexpr size_t kColumn = 20, kWidth = 79;
      for (const auto& o : dr::drd_command_line::kOptions) {
        std::string line = "  " + std::string(o.option);
        std::string_view rest = o.description;
        while (!rest.empty()) {
          line.resize(std::max(line.size() + 1, kColumn), ' ');
          size_t take = rest.size();
          if (kColumn + take > kWidth) take = rest.rfind(' ', kWidth - kColumn);
          if (take == std::string_view::npos || take == 0) take = rest.size();
          help += line + std::string(rest.substr(0, take)) + "\n";
          rest.remove_prefix(std::min(rest.size(), take + 1));
          line.clear();
        }
      }
      help += "\nSee drd(8).\n";
      fputs(help.c_str(), stdout);
      return 0;
    }
  }
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--version") == 0) {
      fputs("drd " DRD_VERSION "\n", stdout);
      return 0;
    }
  }
  return std::nullopt;
}

int Fail(const char* message) {
  dr::SystemLogLine(message, dr::LogPriority::kError);
  sd_notifyf(0, "STATUS=%s", message);
  return 1;
}

}  // namespace

int main(int argc, char** argv) {
  if (std::optional<int> status = AnswerHelpOrVersion(argc, argv)) return *status;
  std::optional<CommandLine> line = ParseCommandLine(argc, argv);
  if (!line) {
    fputs(kUsage, stderr);
    return 2;
  }
  // Blocked before any thread starts, so only run() receives them.
  sigset_t stop;
  sigemptyset(&stop);
  sigaddset(&stop, SIGTERM);
  sigaddset(&stop, SIGINT);
  pthread_sigmask(SIG_BLOCK, &stop, nullptr);
  signal(SIGPIPE, SIG_IGN);
  RaiseDescriptorLimit();

  // Read before the server takes the passed sockets: a socket systemd passed
  // is systemd's to remove, one drd bound is drd's.
  const bool activated = sd_listen_fds(0) > 0;

  dr::Result<dr::RegistryOptions> registryOptions = dr::RegistryOptionsFromEnvironment();
  // The install folders are scanned while the registry opens, and
  // reconciled with it off the service queue once the server follows it.
  dr::InstallFolderOptions installOptions;
  if (registryOptions.ok()) installOptions.folders = registryOptions->installFolders;
  std::unique_ptr<dr::InstallFolders> installFolders = dr::InstallFolders::Start(installOptions);
  dr::Result<std::unique_ptr<dr::Registry>> registry =
      registryOptions.ok() ? dr::Registry::Open(*registryOptions)
                           : dr::Result<std::unique_ptr<dr::Registry>>(registryOptions.error());
  if (!registry.ok()) {
    dr::SystemLogAt(dr::LogPriority::kError, "unable to open the plug-in registry: %@",
                    registry.error());
    return Fail("unable to construct server");
  }
  std::unique_ptr<dr::ServiceManager> serviceManager =
      dr::NewServiceManager({registry->get(), nullptr, nullptr});
  std::unique_ptr<dr::TypeService> types =
      dr::NewTypeService({dr::DataFoldersFromEnvironment(), registry->get()});
  std::unique_ptr<dr::CodeSigning> signing =
      dr::MakeLinuxCodeSigning(dr::ProcessInfo::Default(), dr::FileSystem::Default());
  std::unique_ptr<dr::Sandbox> sandbox =
      dr::MakeLinuxSandbox(dr::SandboxOptionsFromEnvironment(), signing.get());
  std::unique_ptr<dr::Preferences> preferences =
      dr::MakeFilePreferences(dr::PreferencesOptionsFromEnvironment());
  std::unique_ptr<dr::NotificationCenter> notifications =
      dr::MakeFileNotificationCenter(dr::NotificationOptionsFromEnvironment());
  std::unique_ptr<dr::Policy> policy = dr::MakeFilePolicy(dr::PolicyOptionsFromEnvironment());
  std::unique_ptr<dr::UsageReports> usageReports =
      dr::MakeUsageReports(dr::UsageReportOptionsFromEnvironment());

  dr::ServerOptions options;
  options.database.registry = registry->get();
  options.database.notifications = notifications.get();
  options.database.usageReports = usageReports.get();
  options.database.plugInServices.serviceManager = serviceManager.get();
  options.database.plugInServices.sandbox = sandbox.get();
  options.database.plugInServices.types = types.get();
  options.socketDirectory = dr::SocketDirectory();
  options.serviceManager = serviceManager.get();
  options.codeSigning = signing.get();
  options.preferences = preferences.get();
  options.policy = policy.get();
  std::shared_ptr<dr::DRDServer> server =
      dr::DRDServer::initForServiceDatabase(line->serviceName, line->annotationFile, options);
  if (!server) return Fail("unable to construct server");
  server->setVerbose(line->verbose);
  const std::string socketPath = server->service()->path();
  struct stat bound {};
  const bool ownsSocket = !activated && ::lstat(socketPath.c_str(), &bound) == 0;

  if (installFolders) installFolders->attach(registry->get());

  dr::SystemLogAt(dr::LogPriority::kInfo, "drd %s listening on %@ (registry %@)", DRD_VERSION,
                  socketPath, registryOptions->databasePath);
  sd_notify(0, "READY=1");
  server->run();
  sd_notify(0, "STOPPING=1");
  // The socket file drd bound goes with it, so that nothing looks served; it
  // is still drd's own while drd lives (a live socket is never replaced).
  struct stat now {};
  if (ownsSocket && ::lstat(socketPath.c_str(), &now) == 0 && now.st_dev == bound.st_dev &&
      now.st_ino == bound.st_ino) {
    ::unlink(socketPath.c_str());
  }
  dr::SystemLogAt(dr::LogPriority::kInfo, "drd stopped");
  // Connection threads may still be delivering their last events; the
  // process ends here rather than tearing the server down under them.
  fflush(stderr);
#ifdef DRD_COVERAGE
  // _exit skips the coverage counters' own write at exit.
  __gcov_dump();
#endif
  _exit(0);
}
