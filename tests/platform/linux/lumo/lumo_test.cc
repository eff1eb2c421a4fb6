// lumo between real processes: this test process serves "test.a"; peers are lumo_peer.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/wait.h>

#include <atomic>
#include <filesystem>
#include <map>
#include <mutex>
#include <thread>

#include "integration/child_process.h"
#include "platform/dispatch/semaphore.h"
#include "platform/dispatch/serial_queue.h"
#include "platform/linux/identity/process_identity.h"
#include "platform/linux/lumo/lumo_admission.h"
#include "platform/linux/lumo/lumo_service.h"
#include "platform/value/cbor_codec.h"
#include "platform/value/cbor_encoding_memo.h"
#include "platform/value/json_codec.h"
#include "support/log_capture.h"
#include "support/lumo_test_interface.h"
#include "support/scoped_admission_limits.h"

namespace typhora {
namespace {

using namespace std::chrono_literals;
using ::testing::HasSubstr;
using typhora::testing::ChildProcess;
using typhora::testing::runCommand;
using typhora::testing::ScopedAdmissionLimits;
namespace fs = std::filesystem;

// Serves the test interface; remembers who called and whose connections went away.
class Server final : public IpcListenerDelegate, public std::enable_shared_from_this<Server> {
 public:
  explicit Server(LumoService& service) : service_(service) {}

  class Object final : public IpcExportedObject {
   public:
    explicit Object(std::shared_ptr<Server> server) : server_(*server), keep_(std::move(server)) {}
    bool invoke(const IpcOperation& op, const std::vector<Value>& args, IpcReply reply) override {
      const AuditToken caller = IpcConnection::current()->auditToken();
      server_.setLastCaller(caller);
      const SerialQueue* queue = SerialQueue::current();
      if (queue == nullptr || queue->label() != "com.zorvane.lumo.connection") ++server_.offQueue;
      if (running_.exchange(true)) ++server_.overlaps;
      if (op.wireName == "echo:reply:") {
        const Value kept = server_.keptAnswer();
        reply({kept.isNull() ? args[0] : kept});
      }
      if (op.wireName == "count:reply:") reply({Value(*args[0].asInt() + 1)});
      if (op.wireName == "hang:reply:") {
        server_.hung.signal();  // never answered
        if (server_.blockHangs) server_.release.waitFor(30s);
      }
      if (op.wireName == "note:") {
        server_.note(caller.pid, *args[0].asString());
        server_.noted.signal();
      }
      if (op.wireName == "endpoint:reply:") reply({Value(server_.anonymous->endpoint())});
      running_ = false;
      return op.wireName != "useEndpoint:reply:";
    }

   private:
    Server& server_;
    std::atomic<bool> running_{false};  // one object per connection
    std::shared_ptr<Server> keep_;      // handlers may outlive the test that made the server
  };

  bool shouldAcceptNewConnection(IpcListener&, std::shared_ptr<IpcConnection> c) override {
    {
      std::lock_guard lock(mutex_);
      accepted_.push_back(c);
    }
    c->setRemoteInterface(lumoTestInterface());
    c->setExportedInterface(lumoTestInterface());
    c->setExportedObject(std::make_shared<Object>(shared_from_this()));
    c->setInvalidationHandler([self = shared_from_this()] {
      ++self->invalidations;
      self->invalidated.signal();
    });
    c->resume();
    ++accepted;
    return true;
  }

  std::vector<std::shared_ptr<IpcConnection>> connections() {
    std::lock_guard lock(mutex_);
    return accepted_;
  }

  // Handlers of different connections run at once, on threads the test does not join.
  void setLastCaller(const AuditToken& caller) {
    std::lock_guard lock(mutex_);
    lastCaller_ = caller;
  }
  AuditToken lastCaller() {
    std::lock_guard lock(mutex_);
    return lastCaller_;
  }

  // When set, what echo:reply: answers instead of its argument.
  void setKeptAnswer(Value answer) {
    std::lock_guard lock(mutex_);
    keptAnswer_ = std::move(answer);
  }
  Value keptAnswer() {
    std::lock_guard lock(mutex_);
    return keptAnswer_;
  }

  void note(pid_t from, const std::string& text) {
    std::lock_guard lock(mutex_);
    notes_[from].push_back(text);
  }
  std::vector<std::string> notesFrom(pid_t from) {
    std::lock_guard lock(mutex_);
    return notes_[from];
  }

  LumoService& service_;
  std::shared_ptr<IpcListener> anonymous;
  std::atomic<int> accepted{0};
  std::atomic<int> invalidations{0};
  Semaphore invalidated;
  Semaphore hung;
  Semaphore noted;
  std::atomic<bool> blockHangs{false};  // hang:reply: holds its thread until released
  Semaphore release;
  std::atomic<int> offQueue{0};  // invocations that ran off their connection's queue
  std::atomic<int> overlaps{0};  // invocations begun while one of the same connection ran

 private:
  std::mutex mutex_;
  std::map<pid_t, std::vector<std::string>> notes_;
  AuditToken lastCaller_;
  Value keptAnswer_;
  std::vector<std::shared_ptr<IpcConnection>> accepted_;
};

class LumoTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/typhora-lumo-XXXXXX";
    dir_ = mkdtemp(pattern);
    service_ = std::make_unique<LumoService>(dir_);
    server_ = std::make_shared<Server>(*service_);
    listener_ = service_->makeNamedListener("test.a");
    ASSERT_NE(listener_, nullptr);
    listener_->setDelegate(server_);
    listener_->resume();
    server_->anonymous = service_->makeAnonymousListener();
    server_->anonymous->setDelegate(server_);
    server_->anonymous->resume();
  }
  void TearDown() override {
    listener_->invalidate();
    server_->anonymous->invalidate();
    fs::remove_all(dir_);
  }
  std::vector<std::string> peer(std::vector<std::string> args) {
    std::vector<std::string> argv = {LUMO_PEER_PATH, args[0], dir_};
    argv.insert(argv.end(), args.begin() + 1, args.end());
    return argv;
  }
  // Runs `n` callers at once, each its own process; answers how many got the right answer.
  int answeredOfCallers(int n) {
    std::vector<std::thread> clients;
    std::atomic<int> answered{0};
    for (int i = 0; i < n; ++i) {
      clients.emplace_back([&, i] {
        auto r = runCommand(peer({"call", "count:reply:", std::to_string(i)}), 30s);
        answered += r.status == 0 && r.out == "[" + std::to_string(i + 1) + "]\n";
      });
    }
    for (auto& t : clients) t.join();
    return answered.load();
  }
  void waitForInvalidations(int n) {
    for (int i = 0; i < 500 && server_->invalidations < n; ++i) std::this_thread::sleep_for(10ms);
  }

  std::string dir_;
  std::unique_ptr<LumoService> service_;
  std::shared_ptr<Server> server_;
  std::shared_ptr<IpcListener> listener_;
};

TEST_F(LumoTest, ACallFromAnotherProcessIsAnsweredAndItsCallerIdentified) {
  ChildProcess child(peer({"call", "echo:reply:", R"({"a": [1, {"$data": "AAE="}]})"}));
  EXPECT_EQ(child.wait(), 0);
  child.finishOutput();
  EXPECT_EQ(child.standardOutput(), "[{\"a\":[1,{\"$data\":\"AAE=\"}]}]\n");
  EXPECT_EQ(server_->lastCaller().pid, child.pid());
  EXPECT_EQ(server_->lastCaller().uid, getuid());
}

TEST_F(LumoTest, AnEndpointTravelsFromAThroughBToCWhichThenConnectsToA) {
  ChildProcess c(peer({"serve-c"}));
  ASSERT_TRUE(c.waitForLine("ready", 10s));
  auto b = runCommand(peer({"forward"}), 20s);
  EXPECT_EQ(b.status, 0) << b.all;
  EXPECT_EQ(b.out, "from c\n");
  // The last call A served came from C, over the anonymous listener.
  EXPECT_EQ(server_->lastCaller().pid, c.pid());
}

TEST_F(LumoTest, BadMessagesAreRefusedAndEveryoneElseIsStillServed) {
  testing::LogCapture log;
  auto unknown = runCommand(peer({"call", "noSuchThing:", "1"}), 20s);
  EXPECT_NE(unknown.status, 0);  // refused on the caller's side: not in the interface
  auto wrongType = runCommand(peer({"call", "count:reply:", "\"seven\""}), 20s);
  EXPECT_NE(wrongType.status, 0);
  auto garbage = runCommand(peer({"garbage"}), 20s);
  EXPECT_EQ(garbage.status, 0) << "the listener side must close a connection sending junk";
  EXPECT_TRUE(log.contains("lumo error: -[LumoConnection read] - bad frame magic"));
  auto good = runCommand(peer({"call", "count:reply:", "41"}), 20s);
  EXPECT_EQ(good.status, 0);
  EXPECT_EQ(good.out, "[42]\n");
}

TEST_F(LumoTest, OneWayCallsSentJustBeforeThePeerClosesAreServed) {
  constexpr int kNotes = 50;
  auto peerRun = runCommand(peer({"notes", std::to_string(kNotes)}), 60s);
  ASSERT_EQ(peerRun.status, 0) << peerRun.all;
  for (int i = 0; i < kNotes; ++i) ASSERT_TRUE(server_->noted.waitFor(20s)) << i;
}

// A synchronous caller reads its own answer off the socket while the I/O thread stands aside: with
// several of them on one connection, and asynchronous calls in between, every answer still reaches
// its own call.
TEST_F(LumoTest, SynchronousCallersSharingAConnectionEachGetTheirOwnAnswer) {
  auto run = runCommand(peer({"callers", "6", "300"}), 60s);
  EXPECT_EQ(run.status, 0) << run.all;
  EXPECT_EQ(run.out, "0\n");
}

// A caller blocked reading its own answer is released when another thread ends the connection.
TEST_F(LumoTest, ACallerWaitingForAnAnswerIsReleasedWhenTheConnectionEnds) {
  auto connection = service_->connectToService("test.a");
  connection->setRemoteInterface(lumoTestInterface());
  connection->resume();
  std::string error;
  std::thread caller([&] {
    connection->synchronousRemoteObjectProxy([&](const std::string& e) { error = e; })
        ->call("hang:reply:", {}, [](std::vector<Value>) {});
  });
  ASSERT_TRUE(server_->hung.waitFor(20s));
  connection->invalidate();
  caller.join();
  EXPECT_THAT(error, HasSubstr("connection invalidated"));
  // The connection's end reached the server too.
  EXPECT_TRUE(server_->invalidated.waitFor(20s));
}

TEST_F(LumoTest, APeerKilledInTheMiddleOfACallRunsTheInvalidationHandlerOnce) {
  ChildProcess child(peer({"hang"}));
  server_->hung.wait();
  child.kill(SIGKILL);
  child.wait();
  server_->invalidated.wait();
  std::this_thread::sleep_for(50ms);
  EXPECT_EQ(server_->invalidations.load(), 1);
}

// The thread that reads a frame may run the handler itself: a connection's invocations still run
// one at a time, in the order sent, on the connection's queue, with several peers at once.
TEST_F(LumoTest, EachConnectionsInvocationsRunInOrderOnItsQueue) {
  constexpr int kNotes = 300;
  std::vector<std::unique_ptr<ChildProcess>> peers;
  for (int i = 0; i < 3; ++i) {
    peers.push_back(std::make_unique<ChildProcess>(peer({"ordered", std::to_string(kNotes)})));
  }
  for (auto& p : peers) {
    ASSERT_EQ(p->waitFor(60s), 0) << p->output();
    std::vector<std::string> notes = server_->notesFrom(p->pid());
    ASSERT_EQ(notes.size(), static_cast<std::size_t>(kNotes));
    for (int i = 0; i < kNotes; ++i) ASSERT_EQ(notes[i], std::to_string(i));
  }
  EXPECT_EQ(server_->offQueue.load(), 0);
  EXPECT_EQ(server_->overlaps.load(), 0);
}

// Handlers that block (more of them than the loop keeps threads for running handlers) hold no
// other connection up: new peers are accepted, read and answered meanwhile. A peer killed while
// its handler blocks is ended only after that handler has returned.
TEST_F(LumoTest, BlockedHandlersLeaveOtherClientsServedAndAPeerGoneMidHandlerEndsAfterIt) {
  constexpr int kBlocked = 5;
  server_->blockHangs = true;
  std::vector<std::unique_ptr<ChildProcess>> hanging;
  for (int i = 0; i < kBlocked; ++i) {
    hanging.push_back(std::make_unique<ChildProcess>(peer({"hang"})));
    ASSERT_TRUE(server_->hung.waitFor(20s)) << i;
  }
  EXPECT_EQ(answeredOfCallers(6), 6);
  waitForInvalidations(6);  // the callers' ends
  for (int i = 0; i < 6; ++i) ASSERT_TRUE(server_->invalidated.waitFor(1s));

  hanging[0]->kill(SIGKILL);
  hanging[0]->wait();
  EXPECT_FALSE(server_->invalidated.waitFor(300ms)) << "ended while its handler still ran";
  for (int i = 0; i < kBlocked; ++i) server_->release.signal();
  EXPECT_TRUE(server_->invalidated.waitFor(20s));
  EXPECT_EQ(server_->invalidations.load(), 7);
  EXPECT_EQ(server_->overlaps.load(), 0);
}

// An answer holding a large kept encoding goes out in pieces, the kept bytes sent where they lie,
// and is larger than the socket takes at once: every reader gets it whole, call after call.
TEST_F(LumoTest, AnAnswerSentInPiecesArrivesWholeAtEveryReader) {
  std::vector<DictionaryEntry> records;
  for (int i = 0; i < 6000; ++i) {
    records.emplace_back("/fonts/F" + std::to_string(i) + ".otf",
                         Value::dictionary({{"familyName", "Family " + std::to_string(i)},
                                            {"fileSize", 40'000 + i}}));
  }
  const Value fonts = Value(Dictionary(std::move(records)));
  CborEncodingMemo::shared().keep(fonts);
  ASSERT_GT(CborCodec::encode(fonts).size(), 4 * CborCodec::kSpliceBytes);  // now kept
  const Value answer = Value::dictionary({{"fontsInfo", fonts}, {"extension", "token"}});
  server_->setKeptAnswer(answer);
  const std::string expected = JsonCodec::encode(Value::array({answer})) + "\n";
  std::vector<std::thread> readers;
  std::atomic<int> whole{0};
  for (int i = 0; i < 4; ++i) {
    readers.emplace_back([&] {
      for (int call = 0; call < 2; ++call) {
        auto r = runCommand(peer({"call", "echo:reply:", "1"}), 30s);
        whole += r.status == 0 && r.out == expected;
      }
    });
  }
  for (auto& t : readers) t.join();
  CborEncodingMemo::shared().forget(fonts);
  EXPECT_EQ(whole, 8);
}

TEST_F(LumoTest, APeerThatStopsReadingIsCutOffWhileOthersAreAnswered) {
  testing::LogCapture log;
  ChildProcess flood(peer({"flood"}));
  EXPECT_EQ(answeredOfCallers(10), 10);
  for (int i = 0; i < 1000 && !log.contains("cut off"); ++i) std::this_thread::sleep_for(10ms);
  EXPECT_TRUE(log.contains("the peer stopped reading; cut off")) << flood.output();
}

// One one-way message for every peer, its frame queued on each connection: every peer that reads
// gets every copy, and one that never reads piles them up and is cut off alone.
TEST_F(LumoTest, AMessageSentToEveryPeerReachesTheReadersWhileOneThatStopsReadingIsCutOff) {
  testing::LogCapture log;
  ChildProcess deaf(peer({"deaf"}));
  ASSERT_TRUE(deaf.waitForLine("ready", 20s)) << deaf.output();
  constexpr int kNotes = 48;
  ChildProcess first(peer({"listen", std::to_string(kNotes)}));
  ChildProcess second(peer({"listen", std::to_string(kNotes)}));
  ASSERT_TRUE(first.waitForLine("ready", 20s)) << first.output();
  ASSERT_TRUE(second.waitForLine("ready", 20s)) << second.output();
  const auto note = std::make_shared<const IpcSharedMessage>(
      "note:", std::vector<Value>{Value(std::string(64u << 10, 'n'))});
  for (int i = 0; i < kNotes; ++i) {
    // The peers' finished echo calls have gone: sending to them fails and changes nothing.
    for (const auto& connection : server_->connections()) connection->sendShared(note, {});
  }
  EXPECT_EQ(first.waitFor(30s), 0) << first.output();
  EXPECT_EQ(second.waitFor(30s), 0) << second.output();
  EXPECT_EQ(first.countLines("note 65536"), static_cast<std::size_t>(kNotes));
  EXPECT_EQ(second.countLines("note 65536"), static_cast<std::size_t>(kNotes));
  for (int i = 0; i < 1000 && !log.contains("cut off"); ++i) std::this_thread::sleep_for(10ms);
  EXPECT_TRUE(log.contains("the peer stopped reading; cut off")) << deaf.output();
}

TEST_F(LumoTest, AnswersPiledForPeersThatDoNotReadAreBoundedAcrossConnections) {
  // Half of what one peer may pile before its reads pause.
  const ScopedAdmissionLimits limits([](LumoAdmissionLimits& l) { l.outboundBytes = 512u << 10; });
  testing::LogCapture log;
  ChildProcess flood(peer({"flood", "65536"}));
  for (int i = 0; i < 1000 && !log.contains("over their bound"); ++i) {
    std::this_thread::sleep_for(10ms);
  }
  EXPECT_TRUE(log.contains("answers waiting for peers over their bound; cut off"))
      << flood.output();
  EXPECT_FALSE(log.contains("the peer stopped reading")) << "cut off by the stall, not the bound";
  auto r = runCommand(peer({"call", "count:reply:", "1"}), 30s);
  EXPECT_EQ(r.out, "[2]\n") << r.all;
}

TEST_F(LumoTest, AThousandSimultaneousConnectionsAreServed) {
  rlimit limit{};
  getrlimit(RLIMIT_NOFILE, &limit);
  limit.rlim_cur = std::min<rlim_t>(limit.rlim_max, 8192);
  setrlimit(RLIMIT_NOFILE, &limit);
  if (limit.rlim_cur < 4096) GTEST_SKIP() << "not enough descriptors";
  // One user opening a thousand connections at once: past the caps a service puts on one user.
  const ScopedAdmissionLimits limits([](LumoAdmissionLimits& l) {
    l.connectionsPerUser = 2000;
    l.unidentified = 2000;
    l.inboundBytes = 1u << 30;
  });
  LumoService client(dir_);
  std::vector<std::shared_ptr<IpcConnection>> connections;
  std::atomic<int> replies{0};
  Semaphore done;
  for (int i = 0; i < 1000; ++i) {
    auto c = client.connectToService("test.a");
    c->setRemoteInterface(lumoTestInterface());
    c->resume();
    connections.push_back(c);
  }
  for (int i = 0; i < 1000; ++i) {
    connections[static_cast<std::size_t>(i)]
        ->remoteObjectProxy([&](const std::string&) { done.signal(); })
        ->call("count:reply:", {Value(i)}, [&, i](std::vector<Value> r) {
          replies += r.at(0) == Value(i + 1);
          done.signal();
        });
  }
  for (int i = 0; i < 1000; ++i) ASSERT_TRUE(done.waitFor(30s));
  EXPECT_EQ(replies.load(), 1000);
  for (auto& c : connections) c->invalidate();
}

TEST_F(LumoTest, ATokenStopsValidatingOnceItsProcessExecsAnotherProgram) {
  ChildProcess child(peer({"exec-after-call"}));
  for (int i = 0; i < 500 && server_->lastCaller().pid != child.pid(); ++i) {
    std::this_thread::sleep_for(10ms);
  }
  AuditToken token = server_->lastCaller();
  ASSERT_EQ(token.pid, child.pid());
  for (int i = 0; i < 500 && ProcessIdentity::isValid(token); ++i)
    std::this_thread::sleep_for(10ms);
  EXPECT_FALSE(ProcessIdentity::isValid(token));
  EXPECT_FALSE(ProcessIdentity::executablePath(token));
  // The test process's own token stays valid; the zero token never is.
  AuditToken self = ProcessIdentity::ofProcess(getpid(), getuid(), getgid());
  EXPECT_TRUE(ProcessIdentity::isValid(self));
  EXPECT_FALSE(ProcessIdentity::isValid(AuditToken{}));
  child.kill(SIGKILL);
}

}  // namespace
}  // namespace typhora
