// A minimal host: finds the plug-ins of one extension point and readies one
// of them for this process, using only drd's installed client library.
//
//   host_example EXTENSION_POINT [IDENTIFIER]
//
// Build it against an installed drd-client:
//   c++ -std=c++20 host_example.cc $(pkg-config --cflags --libs drd-client)
//
// Prints each plug-in found ("identifier version uuid"), then "readied
// IDENTIFIER" for the one it readied: the first plug-in the user elected, else
// the first one found, or the one named IDENTIFIER; then "read N bytes of
// Contents/Info.pdoc" from its bundle, read the way a sandboxed host must:
// through a token that drd opens. Exit status 0 on success, 1 when drd fails
// or nothing fits, 2 on a bad command line.
#include <drd/client.h>
#include <drd/extension.h>

#include <iostream>
#include <string>

int main(int argc, char** argv) {
  if (argc < 2 || argc > 3) {
    std::cerr << "usage: host_example EXTENSION_POINT [IDENTIFIER]\n";
    return 2;
  }
  namespace client = dr::client;

  auto host = client::Client::Open();
  if (!host.ok()) {
    std::cerr << "cannot reach drd: " << host.error().description() << "\n";
    return 1;
  }

  // A host states what it wants as rules; here: plug-ins of one extension
  // point.
  dr::Value rules{{client::kRuleExtensionPoint, argv[1]}};
  auto plugIns = (*host)->match(rules);
  if (!plugIns.ok()) {
    std::cerr << "discovery failed: " << plugIns.error().description() << "\n";
    return 1;
  }

  const client::PlugIn* chosen = nullptr;
  for (const client::PlugIn& p : *plugIns) {
    std::cout << p.identifier << " " << p.version << " " << p.uuid.string() << "\n";
    const bool wanted =
        argc == 3 ? p.identifier == argv[2] : p.election() == client::Election::kElected;
    if (wanted && !chosen) chosen = &p;
  }
  if (!chosen && argc == 2 && !plugIns->empty()) chosen = &plugIns->front();
  if (!chosen) {
    std::cerr << "no plug-in to ready\n";
    return 1;
  }

  // Readying asks drd to make the plug-in's service reachable from this
  // process; it is refused while the plug-in is held or not for this host.
  if (dr::Status s = (*host)->ready({chosen->uuid}); !s.ok()) {
    std::cerr << "cannot ready " << chosen->identifier << ": " << s.error().description() << "\n";
    return 1;
  }
  std::cout << "readied " << chosen->identifier << "\n";

  // A sandboxed host cannot open the bundle's path; it asks for a token and
  // lets drd open what the token grants.
  auto tokens = (*host)->access({chosen->uuid});
  if (!tokens.ok()) {
    std::cerr << "no token for " << chosen->identifier << ": " << tokens.error().description()
              << "\n";
    return 1;
  }
  auto bundle = client::openExtension((*host)->connection(), tokens->front());
  auto info = bundle.ok() ? bundle->readFile("Contents/Info.pdoc")
                          : dr::Result<std::string>(bundle.error());
  if (!info.ok()) {
    std::cerr << "cannot read the bundle of " << chosen->identifier << ": "
              << info.error().description() << "\n";
    return 1;
  }
  std::cout << "read " << info->size() << " bytes of Contents/Info.pdoc\n";
  return 0;
}
