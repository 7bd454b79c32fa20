#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "simulation/scheduler.h"
#include "simulation/world.h"

namespace kel::simulation {

/// One run of the server in a world drawn from a number: clients ask, bundles change, servers are killed and
/// come again, `mostActions` times in all.
class History {
 public:
  History(std::uint64_t number, std::uint64_t mostActions);
  ~History();

  /// Until the world is still. Throws for whatever must not happen.
  void run();

  /// What happened so far, a line each.
  const std::string& story() const { return story_; }

 private:
  using Title = std::optional<std::string>;  ///< absent: no such bundle
  using Titles = std::map<std::string, std::string>;

  struct Change {
    std::uint64_t moment;
    Title title;
    bool isTold;  ///< by the journal; else only a flush makes a server look
  };

  void startServer();
  void killServer();
  void follow();
  void ask();
  void askFor(const Value& request, bool mustKnowAll);
  void change();
  void changeBundle(const std::string& name, bool isApplication);
  void announce(const std::string& stream);
  static bool isKnowledge(const std::vector<Change>& changes, std::uint64_t since, std::uint64_t flushed,
                          const Title& title);

  bool mayAct(const std::string& what);

  Scheduler scheduler_;
  std::uint64_t actionsLeft_;
  std::string story_;
  World world_;
  std::shared_ptr<Process> outside_ = std::make_shared<Process>(Process{"outside"});
  std::shared_ptr<Process> server_;
  std::uint64_t flushed_ = 0;  // the moment at which the last flush was sent that was carried out
  std::uint64_t moment_ = 0;   // of the last change
  std::map<std::string, std::vector<Change>> bundles_;  // by path, what became of each
  Titles held_;                                         // by the client that follows the seed
};

}  // namespace kel::simulation
