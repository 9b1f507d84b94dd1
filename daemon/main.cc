// drd: the per-user plug-in registry daemon.
//
//   drd [-S servicename] [-v]
//
// Exit status 2 for a bad command line, 1 when the server cannot be built
// (for instance another drd already serves the name), 0 after SIGTERM or
// SIGINT.
#include <signal.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cstdio>
#include <optional>
#include <string>

#include "core/log.h"
#include "daemon/server.h"
#include "platform/install_folders.h"
#include "platform/locations.h"
#include "platform/notifications.h"
#include "platform/policy.h"
#include "platform/preferences.h"
#include "platform/registry.h"
#include "platform/sandbox.h"
#include "platform/types.h"
#include "platform/usage_reports.h"

namespace {

constexpr char kUsage[] = "Usage: drd [-S servicename] [-v]\n";

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

int Fail(const char* message) {
  dr::SystemLogLine(message);
  sd_notifyf(0, "STATUS=%s", message);
  return 1;
}

}  // namespace

int main(int argc, char** argv) {
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

  dr::Result<dr::RegistryOptions> registryOptions = dr::RegistryOptionsFromEnvironment();
  // The install folders are scanned while the registry opens, and
  // reconciled with it off the service queue once the server follows it.
  dr::InstallFolderOptions installOptions;
  if (registryOptions) installOptions.folders = registryOptions->installFolders;
  std::unique_ptr<dr::InstallFolders> installFolders = dr::InstallFolders::Start(installOptions);
  dr::Result<std::unique_ptr<dr::Registry>> registry =
      registryOptions ? dr::Registry::Open(*registryOptions)
                      : dr::Result<std::unique_ptr<dr::Registry>>(registryOptions.error());
  if (!registry) {
    dr::SystemLog("unable to open the plug-in registry: %@", registry.error());
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

  if (installFolders) installFolders->attach(registry->get());

  sd_notify(0, "READY=1");
  server->run();
  sd_notify(0, "STOPPING=1");
  // Connection threads may still be delivering their last events; the
  // process ends here rather than tearing the server down under them.
  fflush(stderr);
  _exit(0);
}
