// Pattern overlap: a breadth-first search over pairs of matcher states. Each pattern is read as
// the matcher reads its compiled list: a sequence of folded literal parts, each placed at or
// after the position the previous one moved to (its start plus its length in bytes), the first
// possibly tied to the start of the text and the last to its end. A state of one pattern says
// which part comes next, how far the text must still go before it may be placed, and which
// units the text still owes to parts already placed. Both patterns read the same text one
// UTF-16 unit at a time; a text both accept exists exactly when a state where both accept is
// reachable.
//
// The matcher looks for each part greedily (first occurrence at or after the position), which
// accepts exactly the texts for which some placement works: an earlier placement only ever
// leaves an earlier position. So the search may try every placement and still agree with it.

#include "core/analyzer/pattern_overlap.h"

#include <unicode/unistr.h>

#include <cassert>
#include <cstdint>
#include <deque>
#include <memory>
#include <optional>
#include <unordered_map>
#include <utility>
#include <vector>

#include "core/analyzer/intake/common.h"

namespace {

// Stands for any character where neither pattern asks for a particular one.
constexpr char16_t kFiller = u'_';

struct Part {
  const char16_t* units;  // folded literal, borrowed from the compiled list
  int32_t length;         // UTF-16 units of units
  int32_t advance;        // how far the matcher's position moves past the part's start: bytes
};

// One pattern as the search sees it.
struct Program {
  std::vector<Part> parts;
  bool startAnchored = false;  // parts[0] begins the text (STARTSWITH, NOWILD)
  bool endAnchored = false;    // parts.back() ends the text (ENDSWITH, NOWILD)
  bool matchesNothing = false;
};

struct ListDeleter {
  void operator()(_PARSE_INFO* list) const { CCommon::freeParseInfo(list); }
};
using ListPtr = std::unique_ptr<_PARSE_INFO, ListDeleter>;

// Reads a list as the matcher does. *owned receives the list compiled here when none was given.
Program Compile(const char* pattern, const _PARSE_INFO* list, ListPtr* owned) {
  Program program;
  if (pattern == nullptr) {
    program.matchesNothing = true;
    return program;
  }
  if (pattern[0] == '*' && pattern[1] == '\0') {
    return program;  // no parts and no anchors: every text
  }
  if (list == nullptr) {
    owned->reset(CCommon::getParseInfo(pattern));
    list = owned->get();
  }
  if (list == nullptr) {
    program.matchesNothing = true;
    return program;
  }
  for (const _PARSE_INFO* e = list; e != nullptr; e = e->next) {
    [[maybe_unused]] const bool first = (e == list);
    [[maybe_unused]] const bool last = (e->next == nullptr);
    const Part part{e->folded.getBuffer(), e->folded.length(), e->length};
    switch (e->matchType) {
      case NOWILD:
        assert(first && last && "NOWILD must be the only element of a compiled list");
        program.startAnchored = program.endAnchored = true;
        break;
      case STARTSWITH:
        assert(first && "STARTSWITH must be the first element of a compiled list");
        program.startAnchored = true;
        break;
      case CONTAINS:
        // The matcher refuses an empty part here.
        program.matchesNothing = program.matchesNothing || part.length == 0;
        break;
      case ENDSWITH:
        assert(last && "ENDSWITH must be the last element of a compiled list");
        program.endAnchored = true;
        program.matchesNothing = program.matchesNothing || part.length == 0;
        break;
      default:
        program.matchesNothing = true;
        break;
    }
    program.parts.push_back(part);
  }
  return program;
}

// Where one pattern stands after some prefix of the text.
struct Cursor {
  int32_t next = 0;     // index of the next part to place
  int32_t gap = 0;      // units the text must still pass before that part may be placed
  int32_t owed = -1;    // part whose rest the text must continue with, or -1
  int32_t offset = 0;   // units of that part already read
  bool closed = false;  // the end-anchored part is placed: the text ends when the debt is paid

  bool operator==(const Cursor&) const = default;
};

int32_t Debt(const Program& p, const Cursor& c) {
  return c.owed < 0 ? 0 : p.parts[c.owed].length - c.offset;
}

bool Accepts(const Program& p, const Cursor& c) {
  return c.next == static_cast<int32_t>(p.parts.size()) && Debt(p, c) == 0;
}

bool CanPlace(const Program& p, const Cursor& c) {
  return c.next < static_cast<int32_t>(p.parts.size()) && c.gap == 0;
}

// Places the next part at the current position, if the units already owed agree with it.
std::optional<Cursor> Place(const Program& p, Cursor c) {
  const Part& part = p.parts[c.next];
  const int32_t debt = Debt(p, c);
  const int32_t common = debt < part.length ? debt : part.length;
  for (int32_t i = 0; i < common; ++i) {
    if (p.parts[c.owed].units[c.offset + i] != part.units[i]) {
      return std::nullopt;
    }
  }
  const bool ends = p.endAnchored && c.next + 1 == static_cast<int32_t>(p.parts.size());
  if (ends && debt > part.length) {
    return std::nullopt;  // an earlier part would run past the end of the text
  }
  if (part.length >= debt) {
    c.owed = part.length > 0 ? c.next : -1;
    c.offset = 0;
  }
  c.gap = part.advance;
  c.closed = ends;
  ++c.next;
  if (c.next == static_cast<int32_t>(p.parts.size())) {
    c.gap = 0;  // nothing left to place: the position no longer matters
  }
  return c;
}

bool CanRead(const Program& p, const Cursor& c) {
  return !c.closed || Debt(p, c) > 0;
}

Cursor Read(const Program& p, Cursor c) {
  if (Debt(p, c) > 0 && ++c.offset == p.parts[c.owed].length) {
    c.owed = -1;
    c.offset = 0;
  }
  if (c.gap > 0) {
    --c.gap;
  }
  return c;
}

Cursor Start(const Program& p) {
  Cursor c;
  if (p.startAnchored) {
    c = *Place(p, c);  // nothing is owed yet, so the first part always fits
  }
  return c;
}

struct State {
  Cursor a;
  Cursor b;
  bool operator==(const State&) const = default;
};

struct StateHash {
  size_t operator()(const State& s) const {
    size_t h = 0;
    for (const Cursor* c : {&s.a, &s.b}) {
      for (int32_t v : {c->next, c->gap, c->owed, c->offset, static_cast<int32_t>(c->closed)}) {
        h = h * 1000003u ^ static_cast<uint32_t>(v);
      }
    }
    return h;
  }
};

struct Node {
  State state;
  int64_t parent;  // index in the node list, -1 for the start
  int32_t unit;    // unit read on the way here, -1 for a placement
};

bool Search(const Program& pa, const Program& pb, std::string* witness) {
  std::vector<Node> nodes;
  std::unordered_map<State, int64_t, StateHash> seen;
  std::deque<int64_t> queue;
  auto visit = [&](const State& s, int64_t parent, int32_t unit) {
    if (seen.emplace(s, static_cast<int64_t>(nodes.size())).second) {
      queue.push_back(static_cast<int64_t>(nodes.size()));
      nodes.push_back(Node{s, parent, unit});
    }
  };
  visit(State{Start(pa), Start(pb)}, -1, -1);
  while (!queue.empty()) {
    const int64_t at = queue.front();
    queue.pop_front();
    const State s = nodes[at].state;
    if (Accepts(pa, s.a) && Accepts(pb, s.b)) {
      if (witness != nullptr) {
        std::u16string units;
        for (int64_t i = at; i >= 0; i = nodes[i].parent) {
          if (nodes[i].unit >= 0) {
            units.insert(units.begin(), static_cast<char16_t>(nodes[i].unit));
          }
        }
        witness->clear();
        icu::UnicodeString(units.data(), static_cast<int32_t>(units.size())).toUTF8String(*witness);
      }
      return true;
    }
    if (CanPlace(pa, s.a)) {
      if (const std::optional<Cursor> a = Place(pa, s.a)) {
        visit(State{*a, s.b}, at, -1);
      }
    }
    if (CanPlace(pb, s.b)) {
      if (const std::optional<Cursor> b = Place(pb, s.b)) {
        visit(State{s.a, *b}, at, -1);
      }
    }
    if (CanRead(pa, s.a) && CanRead(pb, s.b)) {
      const int32_t debtA = Debt(pa, s.a);
      const int32_t debtB = Debt(pb, s.b);
      const char16_t unitA = debtA > 0 ? pa.parts[s.a.owed].units[s.a.offset] : kFiller;
      const char16_t unitB = debtB > 0 ? pb.parts[s.b.owed].units[s.b.offset] : kFiller;
      if (debtA == 0 || debtB == 0 || unitA == unitB) {
        visit(State{Read(pa, s.a), Read(pb, s.b)}, at, debtA > 0 ? unitA : unitB);
      }
    }
  }
  return false;
}

}  // namespace

bool patternsOverlap(const char* a, const _PARSE_INFO* aList, const char* b,
                     const _PARSE_INFO* bList, std::string* witness) {
  ListPtr ownedA;
  ListPtr ownedB;
  const Program pa = Compile(a, aList, &ownedA);
  const Program pb = Compile(b, bList, &ownedB);
  if (pa.matchesNothing || pb.matchesNothing) {
    return false;
  }
  return Search(pa, pb, witness);
}

bool patternsOverlap(const char* a, const char* b, std::string* witness) {
  return patternsOverlap(a, nullptr, b, nullptr, witness);
}
