// drd_docs: writes, at build time, what is made from drd's and drkit's own
// command-line tables rather than written twice: the manual page sources
// (scdoc) of drd(8) and drkit(1), and drkit's bash completion.
//
//   drd_docs drd.8.scd | drkit.1.scd | bash-completion
//
// Standard output; exit status 2 for anything else. The verbs' help texts
// go into the manual as they are, so `drkit help VERB` and `man drkit` say
// the same.
#include <iostream>
#include <string>
#include <string_view>

#include "client/drkit/command_line.h"
#include "daemon/command_line.h"

namespace {

// Text for scdoc outside a literal block: its markup characters escaped.
std::string Escape(std::string_view text) {
  std::string out;
  for (char c : text) {
    if (c == '*' || c == '_' || c == '\\') out += '\\';
    out += c;
  }
  return out;
}

struct Variable {
  const char* name;
  const char* text;
};
constexpr Variable kEnvironment[] = {
    {"DR_SOCKET_DIR", "Folder of drd's socket: $XDG_RUNTIME_DIR/dromon, else /tmp/dromon-<uid>."},
    {"DR_REGISTRY", "The plug-in registry (SQLite): $XDG_DATA_HOME/dromon/registry.sqlite3."},
    {"DR_SYSTEM_ROOTS", "Colon-separated folders that count as the system volume: /usr."},
    {"DR_SDK_PATH",
     "Colon-separated folders of SDK dictionaries: "
     "$XDG_DATA_HOME/dromon/SDKs:/usr/share/dromon/SDKs."},
    {"DR_PLUGIN_PATH",
     "Colon-separated install folders whose bundles drd registers by itself: "
     "$XDG_DATA_HOME/dromon/PlugIns, then dromon/PlugIns in each folder of $XDG_DATA_DIRS."},
    {"DR_POLICY", "The administrator's deny list: /etc/dromon/policy.pdoc."},
    {"DR_USAGE_LOG",
     "File that receives usage reports as JSON lines; unset, they are log lines that start "
     "with \"usage report: \"."},
    {"DR_NOTIFY_DIR", "Folder of change-notification counter files: $DR_SOCKET_DIR/notify."},
    {"XDG_STATE_HOME",
     "The user's annotations (com.corvel.dromon/Annotations) and token key: ~/.local/state."},
    {"XDG_CONFIG_HOME", "Per-host preferences (dromon/ByHost/): ~/.config."},
};

std::string Environment() {
  std::string out;
  for (const Variable& v : kEnvironment) {
    out += "*" + Escape(v.name) + "*\n\t" + Escape(v.text) + "\n\n";
  }
  return out;
}

void DrdManual() {
  namespace cl = dr::drd_command_line;
  std::cout << "drd(8)\n\n# NAME\n\ndrd - " << cl::kSummary << "\n\n# SYNOPSIS\n\n"
            << "*drd* [*-S* _servicename_] [*-v*]\n\n*drd* *--help* | *--version*\n\n"
            << "# DESCRIPTION\n\n"
            << "drd keeps the registry of the user's installed plug-ins (bundles on disk with\n"
               "an information dictionary) and lets host applications discover, ready and\n"
               "annotate them over a Unix socket. It runs once per user, normally started by\n"
               "systemd through *drd.socket* at the first connection.\n\n"
               "drd logs to standard error, one line per message; under systemd each line\n"
               "carries its priority (*journalctl --user -u drd*). At start it logs the socket\n"
               "it serves and the registry it opened, and at a clean stop that it stopped.\n"
               "SIGTERM and SIGINT stop it cleanly; it then removes the socket file it made\n"
               "itself (not one systemd passed it).\n\n# OPTIONS\n\n";
  for (const cl::OptionHelp& o : cl::kOptions) {
    std::string option = o.option;
    std::string text;
    if (size_t space = option.find(' '); space != std::string::npos) {
      text = "*" + Escape(option.substr(0, space)) + "* _" + Escape(option.substr(space + 1)) + "_";
    } else {
      text = "*" + Escape(option) + "*";
    }
    std::cout << text << "\n\t" << Escape(o.description) << "\n\n";
  }
  std::cout << "# ENVIRONMENT\n\n"
            << Environment()
            << "# EXIT STATUS\n\n"
               "0 after SIGTERM or SIGINT, and for *--help* and *--version*; 1 when drd cannot\n"
               "serve (another drd serves the name, or the registry cannot be opened); 2 for a\n"
               "bad command line.\n\n"
               "# SEE ALSO\n\n*drkit*(1), *systemd.socket*(5), *journalctl*(1)\n";
}

void DrkitManual() {
  std::cout << "drkit(1)\n\n# NAME\n\ndrkit - look at and change what drd, the plug-in registry "
               "daemon, knows\n\n# SYNOPSIS\n\n"
               "*drkit* [*-S* _SERVICE_] _VERB_ [_OPTIONS_] [_OPERANDS_]\n\n"
               "*drkit* *help* [_VERB_]\n\n"
               "# DESCRIPTION\n\n"
               "drkit talks to drd over its socket, by default com.corvel.dromon.drd in\n"
               "$DR\\_SOCKET\\_DIR (else $XDG\\_RUNTIME\\_DIR/dromon). Verbs that print accept\n"
               "*--json*: indented on a terminal, one line when piped.\n\n"
               "# OPTIONS\n\n"
               "*-S*, *--service* _SERVICE_\n\tdrd's service name.\n\n"
               "*-h*, *--help*\n\tPrint the general help, or a verb's.\n\n"
               "*--version*\n\tPrint drkit's version.\n\n"
               "# VERBS\n\n";
  for (const dr::drkit::VerbDoc& v : dr::drkit::VerbDocs()) {
    std::cout << "## " << Escape(v.name) << "\n\n```\n" << v.help << "```\n\n";
  }
  std::cout << "# EXIT STATUS\n\n"
               "0 on success; 1 on failure, with drd's message, the name and number of its\n"
               "code on standard error (\"no plugin at /x (bad path, code 9)\"); 2 for a bad\n"
               "command line.\n\n# ENVIRONMENT\n\n"
            << Environment() << "# SEE ALSO\n\n*drd*(8)\n";
}

// Completes verbs, each verb's options and words, and paths where a verb
// takes paths. Plain bash: nothing from the bash-completion package is
// needed.
void BashCompletion() {
  std::string verbs;
  std::string cases;
  for (const dr::drkit::VerbDoc& v : dr::drkit::VerbDocs()) {
    verbs += (verbs.empty() ? "" : " ") + v.name;
    std::string options;
    for (const std::string& o : v.options) options += (options.empty() ? "" : " ") + o;
    cases += "    " + v.name + ") options=\"" + options + "\" ;;\n";
  }
  std::cout << "# bash completion for drkit, made from drkit's own verb table.\n"
               "_drkit() {\n"
               "  local cur=${COMP_WORDS[COMP_CWORD]} prev=${COMP_WORDS[COMP_CWORD-1]}\n"
               "  local verbs=\""
            << verbs
            << "\"\n"
               "  local i verb= options= words=\n"
               "  for ((i = 1; i < COMP_CWORD; i++)); do\n"
               "    case ${COMP_WORDS[i]} in\n"
               "      -S | --service) ((i++)) ;;\n"
               "      -*) ;;\n"
               "      *) verb=${COMP_WORDS[i]}; break ;;\n"
               "    esac\n"
               "  done\n"
               "  if [[ -z $verb ]]; then\n"
               "    case $prev in -S | --service) return 0 ;; esac\n"
               "    if [[ $cur == -* ]]; then\n"
               "      COMPREPLY=($(compgen -W \"-S --service -h --help --version\" -- \"$cur\"))\n"
               "    else\n"
               "      COMPREPLY=($(compgen -W \"$verbs\" -- \"$cur\"))\n"
               "    fi\n"
               "    return 0\n"
               "  fi\n"
               "  case $verb in\n"
            << cases
            << "  esac\n"
               "  case $prev in\n"
               "    --app | --plug-in | --plugin | --host) COMPREPLY=($(compgen -f -- \"$cur\")); "
               "return 0 ;;\n"
               "    -p | -i | --extension-point | --identifier | --rule | --unset | --count)\n"
               "      return 0 ;;\n"
               "  esac\n"
               "  if [[ $cur == -* ]]; then\n"
               "    COMPREPLY=($(compgen -W \"$options\" -- \"$cur\"))\n"
               "    return 0\n"
               "  fi\n"
               "  case $verb in\n"
               "    help) words=$verbs ;;\n"
               "    elect) words=\"use ignore default\" ;;\n"
               "    extension) words=consume ;;\n"
               "    exclude) words=\"add remove list\" ;;\n"
               "    add | remove | explain) COMPREPLY=($(compgen -f -- \"$cur\")); return 0 ;;\n"
               "  esac\n"
               "  COMPREPLY=($(compgen -W \"$words\" -- \"$cur\"))\n"
               "}\n"
               "complete -F _drkit drkit\n";
}

}  // namespace

int main(int argc, char** argv) {
  const std::string what = argc == 2 ? argv[1] : "";
  if (what == "drd.8.scd") {
    DrdManual();
  } else if (what == "drkit.1.scd") {
    DrkitManual();
  } else if (what == "bash-completion") {
    BashCompletion();
  } else {
    std::cerr << "usage: drd_docs drd.8.scd | drkit.1.scd | bash-completion\n";
    return 2;
  }
  return 0;
}
