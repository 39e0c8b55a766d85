// Allocations that fail on purpose: the n-th, once or from then on, of operator new, of the bulk allocator,
// and of realloc and aligned_alloc.
//
// The binary of this room replaces all of them. Nothing fails unless an Armed lives.
#pragma once

#include <cstdint>
#include <exception>
#include <functional>
#include <new>
#include <string>
#include <utility>

namespace test::faults {

enum class Mode { kOnce, kFromThenOn };

/// While it lives, the n-th allocation of the process fails. Processes that it forks have memory.
class Armed {
public:
  Armed(std::int64_t n, Mode mode);
  ~Armed();
  Armed(Armed const&) = delete;
  Armed& operator=(Armed const&) = delete;
};
/// While it lives, the n-th allocation and all behind it fail in each process that is forked.
class ArmedChildren {
public:
  explicit ArmedChildren(std::int64_t n);
  ~ArmedChildren();
  ArmedChildren(ArmedChildren const&) = delete;
  ArmedChildren& operator=(ArmedChildren const&) = delete;
};
/// While it lives, nothing fails inside calls of OpenVDB: its trees allocate while they are destroyed, which
/// ends the process where it throws. Each allocation costs a look at the stack.
class OpenVdbSpared {
public:
  OpenVdbSpared();
  ~OpenVdbSpared();
  OpenVdbSpared(OpenVdbSpared const&) = delete;
  OpenVdbSpared& operator=(OpenVdbSpared const&) = delete;
};
/// How many allocations have failed since the latest Armed was made.
std::int64_t failures();
/// Blocks of the bulk allocator that are in use.
std::int64_t bulkBlocks();

/// What is thrown leaves its subject
enum class After {
  kUnchanged,
  kUsable, ///< so that the same can be tried again, and works
  kTorn,   ///< whole, but fit for nothing but to be dropped
};

/// Something that is done to something else, told in three functions. `State` says what can be seen of the
/// subject.
template <class Subject> struct Scenario {
  std::function<Subject()> make;
  std::function<void(Subject&)> act;
  std::function<std::string(Subject const&)> state;
  After after = After::kUnchanged;
  /// What must hold of the subject even then, also when what is thrown leaves it changed.
  std::function<bool(Subject const&)> sound = {};
  /// How many of the first failures are tried one by one. Fewer where each is dear.
  int dense = 60;
  /// Whether it documents errors of its own for want of memory, beside std::bad_alloc.
  bool ownErrors = false;
};

/// Failures to try: each of them when the environment holds VLN_FAULTS_ALL, else each of the first and ever
/// fewer.
std::int64_t nextTry(std::int64_t n, int dense);
/// Reports a scenario's counts, and what was wrong.
void report(char const* name, std::int64_t tries, std::int64_t thrown);
void expect(bool condition, std::string const& what);

template <class Subject> void everyAllocation(char const* name, Scenario<Subject> const& scenario) {
  std::string done;
  {
    Subject subject = scenario.make();
    scenario.act(subject);
    done = scenario.state(subject);
  }
  std::int64_t tries = 0, thrown = 0;
  for (Mode const mode : {Mode::kOnce, Mode::kFromThenOn}) {
    bool failed = true;
    for (std::int64_t n = 1; failed; n = nextTry(n, scenario.dense)) {
      std::string const where = std::string(name) + ", allocation " + std::to_string(n) +
                                (mode == Mode::kOnce ? " once" : " and all behind it");
      std::int64_t const bulkBefore = bulkBlocks();
      {
        Subject subject = scenario.make();
        std::string const before = scenario.state(subject);
        bool threw = false, other = false;
        {
          Armed const armed(n, mode);
          try {
            scenario.act(subject);
          } catch (std::bad_alloc const&) { threw = true; } catch (std::exception const&) {
            threw = scenario.ownErrors, other = !threw;
          } catch (...) { other = true; }
          failed = failures() > 0;
        }
        expect(!other, where + ": something else was thrown");
        std::string const after = scenario.state(subject);
        if (scenario.sound) expect(scenario.sound(subject), where + ": not sound");
        if (threw && scenario.after == After::kUnchanged)
          expect(after == before, where + ": changed although it threw");
        if (!threw) expect(after == done || (failed && after == before), where + ": half done");
        // Whatever happened, it works now. What was done need not be done again.
        if (after != done || scenario.after == After::kUnchanged) {
          Subject again = scenario.after != After::kTorn && (threw || after == before) ? std::move(subject)
                                                                                       : scenario.make();
          scenario.act(again);
          expect(scenario.state(again) == done, where + ": did not work afterwards");
        }
        ++tries, thrown += threw ? 1 : 0;
      }
      expect(bulkBlocks() == bulkBefore, where + ": lost bulk memory");
    }
  }
  report(name, tries, thrown);
}

} // namespace test::faults
