#include "simulation/history.h"

#include <algorithm>
#include <stdexcept>
#include <utility>

#include "server/run_as_server.h"

namespace kel::simulation {

using namespace std::chrono_literals;

namespace {

const std::string seedName = "user.uid.501.com.orvex.qvservices.seed";
constexpr const char* registryStream = platform::launch_streams::databaseChanges;
constexpr const char* directoryStream = platform::launch_streams::directoryChanges;

/// The main thread of a server; it has what dies with it.
struct ServerProcess : platform::Process {
  explicit ServerProcess(World& itsWorld)
      : world(itsWorld),
        platform{.clock = world.clock,
                 .concurrentQueue = pool,
                 .files = world.files,
                 .directories = world.directories,
                 .bundles = world.bundles,
                 .facts = world.facts,
                 .log = world.log,
                 .transactions = world.transactions,
                 .conduit = world.conduit,
                 .sandbox = world.sandbox,
                 .launchEvents = world.launchEvents,
                 .seeds = world.seeds,
                 .publication = world.publication,
                 .preferences = world.publication,
                 .applications = world.registry,
                 .journal = world.journal,
                 .process = *this,
                 .constants = constants} {}

  void onTermination(platform::Task) override {}
  void exitNow(int) override {}
  void runMainLoop() override {
    Scheduler::current().wait([] { return false; });
  }

  ~ServerProcess() override { world.launchEvents.forgetHandlers(); }

  World& world;
  platform::ConcurrentQueue pool;
  platform::ProcessConstants constants;
  platform::Platform platform;
};

[[noreturn]] void fail(const std::string& what) { throw std::runtime_error(what); }

std::map<std::string, std::string> titlesIn(const Value& list) {
  std::map<std::string, std::string> titles;
  for (const Value& service : *list.asArray()) {
    const Dictionary& keys = *service.asDictionary();
    const std::string& path = *keys.find("QVBundlePath")->asString();
    if (!titles.emplace(path, *keys.find("QVMenuItem")->asDictionary()->find("default")->asString()).second) {
      fail(path + " stands twice in the list");
    }
  }
  return titles;
}

std::optional<std::string> titleIn(const std::map<std::string, std::string>& titles,
                                   const std::string& path) {
  const auto found = titles.find(path);
  return found == titles.end() ? std::nullopt : std::optional(found->second);
}

}  // namespace

History::History(std::uint64_t number, std::uint64_t mostActions)
    : scheduler_(number), actionsLeft_(mostActions) {}

History::~History() {
  if (server_) scheduler_.kill(*server_);
  scheduler_.kill(*outside_);
}

void History::run() {
  world_.files.failsWrites = scheduler_.oneIn(4);
  world_.files.failsReads = scheduler_.oneIn(4);
  startServer();
  scheduler_.spawn(
      "follower", [this] { follow(); }, outside_);
  for (std::uint64_t client = 1 + scheduler_.draw(3); client > 0; --client) {
    scheduler_.spawn(
        "client", [this] { ask(); }, outside_);
  }
  scheduler_.spawn(
      "disk", [this] { change(); }, outside_);
  if (scheduler_.oneIn(2)) {
    scheduler_.spawn(
        "fate", [this] { killServer(); }, outside_);
  }
  scheduler_.run();

  for (const auto& [path, changes] : bundles_) {
    const Title held = titleIn(held_, path);
    if (!isKnowledge(changes, moment_, flushed_, held)) {
      fail("who follows the seed holds " + path + " as " + held.value_or("gone") + ", which is " +
           changes.back().title.value_or("gone"));
    }
  }
  for (const auto& [path, title] : held_) {
    if (!bundles_.contains(path)) fail(path + " is held, and was never there");
  }
}

bool History::mayAct(const std::string& what) {
  if (actionsLeft_ == 0) return false;
  --actionsLeft_;
  story_ += std::to_string(std::chrono::duration<double>(scheduler_.now()).count()) + " s: " + what + "\n";
  return true;
}

void History::startServer() {
  server_ = std::make_shared<Process>(Process{"server"});
  scheduler_.spawn(
      "main",
      [this] {
        ServerProcess process(world_);
        run_as_server(process.platform);
      },
      server_);
}

void History::killServer() {
  for (std::uint64_t times = 1 + scheduler_.draw(2); times > 0; --times) {
    scheduler_.sleep(std::chrono::milliseconds(scheduler_.draw(8000)));
    for (std::uint64_t steps = scheduler_.draw(60); steps > 0; --steps) scheduler_.yield();
    if (!mayAct("the server is killed and started")) return;
    scheduler_.kill(*server_);
    flushed_ = 0;  // it may have been answered and not carried out
    if (scheduler_.oneIn(2)) world_.facts.boot.value = *world_.facts.boot.value + 1;
    if (scheduler_.oneIn(2)) world_.clock.wallClockOffset -= static_cast<double>(scheduler_.draw(100));
    startServer();
  }
}

void History::follow() {
  const auto token = world_.seeds.registerName(seedName);
  for (std::uint64_t seen = 0;;) {
    scheduler_.wait([&] { return world_.seeds.state(token) != seen; });
    seen = world_.seeds.state(token);
    const platform::ConduitReply reply =
        world_.conduit.ask(test::dictionary({{"command", "get_services_plist"}}));
    const Value* contents = std::get_if<Value>(&reply);
    if (!contents) continue;
    const Value* data = contents->asDictionary()->find("data");
    if (!data) fail("the follower got no data");
    held_ = titlesIn(*platform::readPropertyList(**data->asData()).value);
  }
}

void History::ask() {
  for (std::uint64_t requests = 1 + scheduler_.draw(4); requests > 0; --requests) {
    if (scheduler_.oneIn(3)) scheduler_.sleep(std::chrono::milliseconds(scheduler_.draw(7000)));
    switch (scheduler_.draw(6)) {
      case 0:
        askFor(test::dictionary({{"command", "flush"}}), false);
        break;
      case 1:
      case 2:
        askFor(test::dictionary({{"command", "get_and_update_services_plist"}}), true);
        break;
      case 3: {
        const char* names[] = {"de", "fr", "ja"};
        askFor(test::dictionary({{"localizations", test::Array{names[scheduler_.draw(3)]}}}), false);
        break;
      }
      default:
        askFor(test::dictionary({{"command", "get_services_plist"}}), false);
    }
  }
}

void History::askFor(const Value& request, bool mustKnowAll) {
  if (!mayAct("asked for " + platform::describe(request))) return;
  const std::uint64_t sent = moment_;
  const std::uint64_t flushed = flushed_;
  const platform::ConduitReply reply = world_.conduit.ask(request);
  const Value* contents = std::get_if<Value>(&reply);
  if (!contents) return;
  const Value* command = request.asDictionary()->find("command");
  const bool isFlush = command && *command->asString() == "flush";
  const Value* data = contents->asDictionary()->find("data");
  if (isFlush) flushed_ = sent;
  if (isFlush == (data != nullptr)) fail(isFlush ? "a flush was answered with data" : "no data");
  if (!data) return;
  const Titles titles = titlesIn(*platform::readPropertyList(**data->asData()).value);
  for (const auto& [path, changes] : bundles_) {
    const Title listed = titleIn(titles, path);
    if (mustKnowAll && !world_.files.failsReads && !isKnowledge(changes, sent, flushed, listed)) {
      fail("an update answered with " + path + " as " + listed.value_or("gone"));
    }
  }
}

/// Whether somebody who asked at the moment `since` may hold `title`. What the journal did not tell need not
/// be known unless a flush came after it.
bool History::isKnowledge(const std::vector<Change>& changes, std::uint64_t since, std::uint64_t flushed,
                          const Title& title) {
  for (auto change = changes.rbegin(); change != changes.rend(); ++change) {
    if (change->title == title) return true;
    if (change->moment <= since && (change->isTold || change->moment <= flushed)) return false;
  }
  return !title;
}

void History::change() {
  for (std::uint64_t changes = 1 + scheduler_.draw(6); changes > 0; --changes) {
    if (scheduler_.oneIn(3)) scheduler_.sleep(std::chrono::milliseconds(scheduler_.draw(7000)));
    for (std::uint64_t steps = scheduler_.draw(30); steps > 0; --steps) scheduler_.yield();
    const bool isApplication = scheduler_.oneIn(3);
    changeBundle(std::string(1, static_cast<char>('a' + scheduler_.draw(3))), isApplication);
  }
}

void History::changeBundle(const std::string& name, bool isApplication) {
  const std::string directory = isApplication ? "/home/u/Applications/" : "/home/u/Library/Services/";
  const std::string path = directory + name + (isApplication ? ".app" : ".service");
  const auto known = bundles_.find(path);
  const bool wasThere = known != bundles_.end() && known->second.back().title;
  const bool isThere = !wasThere || !scheduler_.oneIn(3);
  const std::uint64_t moment = moment_ + 1;
  const Title title = isThere ? std::optional("T" + std::to_string(moment)) : std::nullopt;
  const bool isTold = !wasThere || !isThere || isApplication || !scheduler_.oneIn(4);
  if (!mayAct(path + " is " + title.value_or("gone") + (isTold ? "" : ", untold"))) return;
  moment_ = moment;
  bundles_[path].push_back({moment, title, isTold});
  if (isThere) {
    test::addBundle(world_.files, path,
                    test::information(std::string("org.") + (isApplication ? "app." : "") + name, *title));
  } else {
    world_.files.removeTree(path);
  }
  if (!isTold) return;
  world_.journal.record(wasThere && isThere ? path + "/Info.plist" : path);
  if (wasThere != isThere) world_.journal.record(directory + ".");
  announce(directoryStream);
  if (!isApplication) return;
  std::erase_if(world_.registry.registered,
                [&path](const auto& application) { return application.path == path; });
  if (isThere) world_.registry.registered.push_back({path});
  announce(registryStream);
}

/// The word of a change comes when it comes.
void History::announce(const std::string& stream) {
  scheduler_.spawn(
      "word of a change",
      [this, stream] {
        scheduler_.sleep(std::chrono::milliseconds(scheduler_.oneIn(2) ? 0 : scheduler_.draw(3000)));
        world_.launchEvents.fire(stream);
      },
      outside_);
}

}  // namespace kel::simulation
