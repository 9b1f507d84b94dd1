// The trace probes as a tracer sees them: the notes of the built program,
// read with readelf, list all ten probes of provider drd with their
// semaphores and argument sizes.
#include "platform/probes.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <map>
#include <regex>
#include <string>

namespace dr {
namespace {

struct NoteProbe {
  std::string semaphore;
  std::string arguments;
};

// Provider-drd probes of the running test program, by name.
std::map<std::string, NoteProbe> ReadProbeNotes() {
  const std::string exe = std::filesystem::read_symlink("/proc/self/exe");
  FILE* pipe = ::popen(("readelf -n '" + exe + "' 2>&1").c_str(), "r");
  std::string text;
  char buffer[4096];
  for (size_t n; pipe && (n = std::fread(buffer, 1, sizeof buffer, pipe)) > 0;) {
    text.append(buffer, n);
  }
  if (pipe) ::pclose(pipe);
  static const std::regex kProbe(
      R"(Provider: drd\s+Name: (\S+)\s+Location: [^\n]*Semaphore: (0x[0-9a-f]+)\s+Arguments: ([^\n]*))");
  std::map<std::string, NoteProbe> probes;
  for (std::sregex_iterator it(text.begin(), text.end(), kProbe), end; it != end; ++it) {
    probes[(*it)[1]] = {(*it)[2], (*it)[3]};
  }
  return probes;
}

// Argument sizes as the notes state them ("-4@%edi 8@%rsi" -> "-4 8").
std::string Sizes(const std::string& arguments) {
  static const std::regex kSize(R"((-?\d+)@\S+)");
  std::string out;
  for (std::sregex_iterator it(arguments.begin(), arguments.end(), kSize), end; it != end; ++it) {
    if (!out.empty()) out += ' ';
    out += (*it)[1];
  }
  return out;
}

TEST(ProbesTest, ReadelfListsAllTenProbesWithSemaphoresAndArgumentSizes) {
  // Every probe is used here, so its note is part of this program.
  int pid = static_cast<int>(::getpid());
  probes::ClientNew(pid);
  probes::ClientDone(pid);
  probes::Request(pid, nullptr);
  probes::RequestInput(pid, "in");
  probes::RequestOutput(pid, "out");
  probes::DbLoad("Dromon", 7);
  probes::DiscoverRaw(3u);
  probes::PluginAdd("/p");
  probes::PluginRemove("/p", true);
  probes::PluginReady("1B4E28BA-2FA1-11D2-883F-0016D3CCA427");
  // No tracer is attached.
  EXPECT_FALSE(probes::RequestInputEnabled());
  EXPECT_FALSE(probes::RequestOutputEnabled());

  std::map<std::string, NoteProbe> notes = ReadProbeNotes();
  struct Expected {
    const char* name;
    const char* sizes;  // signed int -4, pointer 8, uint64 8, unsigned 4, bool 1
  } expected[] = {
      {"client-new", "-4"},      {"client-done", "-4"},      {"request", "-4 8"},
      {"request-input", "-4 8"}, {"request-output", "-4 8"}, {"db-load", "8 8"},
      {"discover-raw", "4"},     {"plugin-add", "8"},        {"plugin-remove", "8 1"},
      {"plugin-ready", "8"},
  };
  for (const Expected& e : expected) {
    SCOPED_TRACE(e.name);
    auto it = notes.find(e.name);
    ASSERT_NE(it, notes.end()) << "no note for drd:" << e.name;
    EXPECT_NE(it->second.semaphore.find_first_of("123456789abcdef", 2), std::string::npos);
    EXPECT_EQ(Sizes(it->second.arguments), e.sizes) << it->second.arguments;
  }
  EXPECT_EQ(notes.size(), std::size(expected));
}

}  // namespace
}  // namespace dr
