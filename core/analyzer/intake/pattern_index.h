#pragma once

// PatternIndex: for an ordered list of wildcard pattern pairs (application and transaction, or
// host name and address), finds the pairs that could match a pair of texts without trying every
// pair. Matching then tests only those candidates, in list order, so the first that matches is
// the first the ordered scan would have found.
//
// A candidate set is a superset of the matches: each field of a pair is filed by what a matching
// text must show in full (a fixed text), at its start (a leading literal) or at its end (a
// trailing literal), and a field that shows none of these ("*", "*part*", patterns with
// non-ASCII parts, which ICU may fold onto ASCII) is a candidate for every text. Only ASCII
// texts are indexed: for any other text the caller scans in order.
//
// Ownership: the index copies nothing it does not own; it keeps indexes into the caller's list
// only, and must be rebuilt whenever that list changes.
// Thread safety: build and candidates mutate the index's state (candidates reuses scratch
// space); the owner serialises both, as CSituationController does under its pattern lock.

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "core/analyzer/intake/parse_info.h"

class PatternIndex {
 public:
  // One field of a pair: the pattern text and its compiled list (null when it has none).
  struct Field {
    const char* pattern = nullptr;
    const _PARSE_INFO* list = nullptr;
  };

  // Replaces the index with one over pairs, in matching order.
  void build(const std::vector<std::pair<Field, Field>>& pairs);

  // Folds first and second (ASCII only) into the index's scratch and returns the candidates in
  // ascending order; false, with nothing filled, when either text is not ASCII. The folded texts
  // stay readable through foldedFirst/foldedSecond until the next call.
  bool candidates(const char* first, const char* second, std::vector<uint32_t>* out);
  const std::string& foldedFirst() const { return folded_[0]; }
  const std::string& foldedSecond() const { return folded_[1]; }

  size_t size() const { return size_; }

 private:
  // Literals filed character by character; each node lists the pairs whose literal ends there.
  struct Trie {
    struct Node {
      std::vector<std::pair<unsigned char, uint32_t>> children;  // sorted by character
      std::vector<uint32_t> ends;
    };
    std::vector<Node> nodes{1};
    void insert(const char* text, size_t n, bool reversed, uint32_t id);
    // Marks in bits the ids of every literal that the text starts with (or ends with when
    // reversed); with exactOnly, only a literal as long as the whole text.
    void mark(const std::string& text, bool reversed, bool exactOnly, uint64_t* bits) const;
  };

  struct FieldIndex {
    std::vector<uint64_t> always;  // bit per pair: a candidate for any text
    Trie exact;                    // the whole text
    Trie prefix;                   // its start
    Trie suffix;                   // its end, filed backwards
    void file(const Field& field, uint32_t id);
    void mark(const std::string& folded, uint64_t* bits) const;
  };

  size_t size_ = 0;
  size_t words_ = 0;
  FieldIndex fields_[2];
  std::string folded_[2];
  std::vector<uint64_t> scratch_[2];
};
