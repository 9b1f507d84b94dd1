// The client library against a stand-in for drd, and drkit's command line
// and JSON.
#include <gtest/gtest.h>

#include <atomic>
#include <functional>
#include <mutex>
#include <sstream>
#include <thread>

#include "client/drkit/command_line.h"
#include "client/drkit/output.h"
#include "client/include/drd/client.h"
#include "tests/support/process_fixtures.h"
#include "tests/support/stand_in_listener.h"

namespace dr {
namespace {

using namespace client;
using namespace drkit;
using namespace std::chrono_literals;
const Uuid kA = *Uuid::parse("1B4E28BA-2FA1-11D2-883F-0016D3CCA427");

// A stand-in for drd on a real socket: records each message, answers with
// the reply set or else by its "do": "hang up", "ignore", "sleep" ("ms") or echo.
class ClientTest : public ::testing::Test {
 protected:
  void SetUp() override {
    listener_ = testing::StartStandInListener(
        sockets_, "com.example.client", &queue_,
        [this](const std::shared_ptr<PeerConnection>& conn, const ConnectionEvent& e) {
          if (e.kind != ConnectionEvent::Kind::kMessage || !conn) return;
          std::unique_lock<std::mutex> lock(mu_);
          ++seen_;
          sent_ = e.message.body;
          if (sent_["do"] == Value("hang up")) return conn->cancel();
          if (sent_["do"] == Value("ignore") || !e.message.wantsReply) return;
          const Value reply = reply_.isPresent() ? reply_ : e.message.body;
          lock.unlock();
          std::this_thread::sleep_for(std::chrono::milliseconds(reply["ms"].intValue()));
          conn->sendReply(e.message.serial, reply);
        });
    ASSERT_TRUE(listener_);
  }

  testing::TempFolder folder_;
  const std::string sockets_ = folder_.path() + "/sockets";
  SerialQueue queue_{"ipc"};
  std::unique_ptr<Listener> listener_;
  std::mutex mu_;
  int seen_ = 0;        // guarded by mu_, as is sent_
  Value sent_, reply_;  // reply_ is set before the requests it answers
};

using Code = std::pair<std::string, int64_t>;
Code CodeOf(const Status& s) {
  return s.ok() ? Code() : Code(s.error().domain(), s.error().code());
}

// A call sends its request with the version, relays drd's error, and fails
// on a reply without what it promises. (drkit's end-to-end tests send the
// other requests through this library to the real drd.)
TEST_F(ClientTest, CallsRelayDrdsErrorsAndRefuseRepliesMissingWhatWasPromised) {
  auto client_ = std::move(Client::Open("com.example.client", sockets_).value());
  reply_ = Value{{"errorcode", uint64_t{9}}, {"error", "bad path"}};
  Status s = client_->bulk(3);
  EXPECT_EQ(sent_, (Value{{"request", "bulk"}, {"flags", uint64_t{3}}, {"version", uint64_t{2}}}));
  EXPECT_EQ(s.ok() ? Error("", 0) : s.error(), Error(kDaemonErrorDomain, 9, "bad path"));
  reply_ = Value{{"errorcode", uint64_t{14}}};  // no text: one of the library's own
  EXPECT_EQ(client_->ready({kA}).error().localizedDescription(), "drd error 14");
  auto match = [](Client& c) { return c.match(Value()).status(); };
  auto access = [](Client& c) { return c.access({kA, kA}).status(); };
  const std::pair<Value, std::function<Status(Client&)>> rows[] = {
      {Value::EmptyDictionary(), match},
      {Value{{"matches", Value(Array{Value{{"identifier", "a"}, {"path", "/p"}}})}}, match},
      {Value{{"extensions", Value(Array{"only one"})}}, access},
      {Value{{"extensions", Value(Array{1, 2})}}, access},
      {Value{{"uuids", kA.string()}},
       [](Client& c) { return c.hold(HoldTarget::kPlugIn, {"/p"}).status(); }},
  };
  for (const auto& [reply, call] : rows) {
    reply_ = reply;
    EXPECT_EQ(CodeOf(call(*client_)), Code(kClientErrorDomain, kUnexpectedReply))
        << reply.description();
  }
}

// Each caller gets its own reply: the late reply to a request that timed out
// is skipped. A message that cannot be sent sends nothing; a connection drd
// closed fails every call after, and never hangs.
TEST_F(ClientTest, ConnectionSkipsLateRepliesAndFailsOnceClosed) {
  auto opened = Connection::Open("com.example.client", sockets_);
  ASSERT_TRUE(opened.ok());
  Connection& c = **opened;
  std::atomic<int> wrong{0};
  auto echoed = [&c](const Value& v) { return c.request(v, 5s).value_or(Value()) == v; };
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 50; ++i) wrong += !echoed(Value{{"t", t}, {"i", i}});
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(wrong, 0);
  for (const Value& unsendable : {Value(Array{Value(1)}), Value{{"s", std::string("\xC3\x28")}}})
    EXPECT_FALSE(c.request(unsendable, 1s).ok() || c.send(unsendable).ok())
        << unsendable.description();
  for (const Value& late : {Value{{"do", "sleep"}, {"ms", 400}}, Value{{"do", "ignore"}}})
    EXPECT_EQ(CodeOf(c.request(late, 100ms).status()), Code(kClientErrorDomain, kTimeout));
  EXPECT_TRUE(echoed(Value{{"n", 2}}));
  EXPECT_EQ(seen_, 203) << "the unsendable messages reached drd";
  EXPECT_EQ(c.request(Value{{"do", "hang up"}}).error().localizedDescription(),
            "connection closed by drd");
  EXPECT_EQ(CodeOf(c.request(Value{{"n", 1}}, 5s).status()),
            Code(kClientErrorDomain, kConnectionClosed));
  EXPECT_FALSE(c.isOpen() || c.send(Value{{"n", 1}}).ok());
  EXPECT_EQ(CodeOf(Connection::Open("", sockets_).status()), Code(kPosixErrorDomain, EINVAL));
  EXPECT_EQ(CodeOf(Connection::Open("x", folder_ / std::string(200, 'x')).status()),
            Code(kPosixErrorDomain, ENAMETOOLONG));
}

// drkit's arguments (split at spaces) as parsed, or "! " and the usage error.
std::string Parse(const std::string& args) {
  std::vector<std::string> argv = {"drkit"};
  std::istringstream in(args);
  for (std::string a; in >> a;) argv.push_back(a);
  Result<Invocation> inv = ParseCommandLine(argv);
  if (!inv.ok()) return "! " + inv.error().localizedDescription();
  const Invocation& i = *inv;
  std::string out = i.verb + (i.service != kDefaultServiceName ? " S=" + i.service : "") +
                    (i.help ? " help" : "") + (i.version ? " version" : "") +
                    (i.verbose ? " verbose" : "") + (i.json ? " json" : "") +
                    (i.flags ? " flags=" + std::to_string(i.flags) : "") +
                    (i.rules.isPresent() ? " rules=" + ToJson(i.rules, false) : "") +
                    (i.identifier.empty() ? "" : " id=" + i.identifier) +
                    (i.host.empty() ? "" : " host=" + i.host);
  for (const std::string& key : i.unset) out += " unset=" + key;
  for (const std::string& operand : i.operands) out += " [" + operand + "]";
  return out;
}

TEST(DrkitTest, ParsesCommandLinesAndJson) {
  const std::pair<std::string, std::string> rows[] = {
      {"-Sx match -v --json --hybrid --system-only --duplicates --all",  // implies --all-versions
       "match S=x verbose json flags=781"},
      {"--service=x -- match --all-v", "match S=x flags=1"},
      // A key given twice lists alternatives; after ':=' a pattern is JSON.
      {"match -i a --rule=k==v --rule n:=3 --rule n:=-1 --rule T:={\"a\":[1]} --rule v=1.0",
       R"(match rules={"T":{"a":[1]},"UXExtensionIdentifier":"a","k":"=v","n":[3,-1],"v":"1.0"})"},
      {"annotate -i com.x a=1 --unset b c= -- -d=2", "annotate id=com.x unset=b [a=1] [c=] [-d=2]"},
      {"explain com.x --host /A.app --all-versions", "explain flags=1 host=/A.app [com.x]"},
      {"--help hold", "hold help"},  // asked before the operands are checked
      {"--version", " version"},
      {"-S", "! option '-S' needs a value"},
      {"--service= match", "! the service name must not be empty"},
      {"-q match", "! unknown option '-q'"},
      {"match --bogus=1", "! match: unknown option '--bogus'"},
      {"match --rule", "! match: option '--rule' needs a value"},
      {"match --rule novalue", "! match: expected --rule KEY=PATTERN or --rule KEY:=JSON"},
      {"match --rule n:=three", "! match: --rule n:=three: not valid JSON"},
      {"match --rule n:=null", "! match: --rule n:=null: null is not a value drd knows"},
      {"match --rule :=1", "! match: a rule needs a key: KEY=PATTERN"},
      {"match stray", "! match: unexpected operand 'stray'"},
      {"elect -i a", "! elect: missing operand"},
      {"elect -i a on", "! elect: expected use, ignore or default, not 'on'"},
      {"elect -i a -i b use", "! elect: -i may be given once"},
      {"annotate -i a =v", "! annotate: expected KEY=VALUE, not '=v'"},
      {"annotate x=1", "! annotate: -i ID is required"},
      {"annotate -i a --unset=", "! annotate: --unset needs a key"},
      {"hold", "! hold: --app PATH or --plug-in PATH is required"},
      {"hold --app /a --plug-in /b", "! hold: --app and --plug-in do not mix"},
      {"ready 1B4E28BA-2FA1-11D2-883F-0016D3CCA42",
       "! ready: not a UUID: '1B4E28BA-2FA1-11D2-883F-0016D3CCA42'"},
      {"extension eat t", "! extension: unknown action 'eat' (expected consume or open)"},
      {"exclude add", "! exclude: add takes rules: -p, -i or --rule"},
      {"exclude remove 0", "! exclude: remove takes rules or one number from 'list'"},
      {"exclude list -i a", "! exclude: list takes nothing more"},
      {"exclude drop", "! exclude: unknown action 'drop' (expected add, remove or list)"},
      {"watch --count -1", "! watch: --count needs a number, not '-1'"},
      {"explain a -i b", "! explain: unknown option '-i'"},
      {"help nothing", "! help: no such verb 'nothing'"},
  };
  for (const auto& [args, expected] : rows) EXPECT_EQ(Parse(args), expected) << args;
  // Each verb has help, and takes every option its manual page and completion offer.
  for (const VerbDoc& v : VerbDocs()) {
    EXPECT_NE(GeneralHelp().find("\n  " + v.name + " "), std::string::npos) << v.name;
    EXPECT_EQ(v.help.rfind("Usage: drkit " + v.synopsis + "\n" + v.summary + ".\n\n", 0), 0u);
    EXPECT_EQ(Parse("help " + v.name) + Parse(v.name + " --help"),
              "help [" + v.name + "]" + v.name + " help");
    for (const std::string& option : v.options)
      EXPECT_EQ(Parse(v.name + " " + option + " 1 --help").find("unknown"), std::string::npos)
          << option;
  }
  EXPECT_EQ(VerbHelp("nothing"), "");
  // What raw prints can be sent again (a JSON integer >= 0 as unsigned, the
  // protocol's integer); what drd cannot carry is refused.
  const Value message(Array{Value("text \"quoted\" é"), Value(uint64_t{18446744073709551615u}),
                            Value(int64_t{-3}), Value(1.5), Value(true), Value(Uuid::random()),
                            Value(Data{0, 1, 2, 255}), Value(Data{}), Value(Date{1700000000.5}),
                            Value{{"$uuid", "x"}, {"y", 1}}, Value::EmptyArray()});
  EXPECT_EQ(FromJson(ToJson(message)).value_or(Value()), message);
  EXPECT_EQ(FromJson("[2]")->array()[0].type(), Value::Type::kUInt);
  for (const std::string& bad :
       {std::string("{"), std::string(R"([1, null])"),
        std::string(100, '[') + std::string(100, ']'), std::string(R"({"$data": "not base64!"})"),
        std::string(R"({"$date": "today"})"), std::string(R"({"$what": 1})")})
    EXPECT_FALSE(FromJson(bad).ok()) << bad;
  EXPECT_EQ(DescribeError(Error(kDaemonErrorDomain, 99, "new")), "new (drd error, code 99)");
}

}  // namespace
}  // namespace dr
