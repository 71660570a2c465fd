#include "core/analyzer/intake/pattern_index.h"

#include <string.h>

#include <algorithm>

#include "core/analyzer/intake/common.h"

namespace {

// The last element of a list.
const _PARSE_INFO* lastElement(const _PARSE_INFO* list) {
  while (list->next != nullptr) {
    list = list->next;
  }
  return list;
}

bool allAscii(const _PARSE_INFO* list) {
  for (; list != nullptr; list = list->next) {
    if (list->asciiFolded == nullptr) {
      return false;
    }
  }
  return true;
}

void setBit(uint64_t* bits, uint32_t id) { bits[id / 64] |= uint64_t{1} << (id % 64); }

}  // namespace

void PatternIndex::Trie::insert(const char* text, size_t n, bool reversed, uint32_t id) {
  uint32_t at = 0;
  for (size_t i = 0; i < n; ++i) {
    const auto c = static_cast<unsigned char>(reversed ? text[n - 1 - i] : text[i]);
    auto& children = nodes[at].children;
    auto it = std::lower_bound(children.begin(), children.end(), c,
                               [](const auto& child, unsigned char key) { return child.first < key; });
    if (it != children.end() && it->first == c) {
      at = it->second;
      continue;
    }
    const auto next = static_cast<uint32_t>(nodes.size());
    children.insert(it, {c, next});
    nodes.emplace_back();  // may move every node: nothing above is used past here
    at = next;
  }
  nodes[at].ends.push_back(id);
}

void PatternIndex::Trie::mark(const std::string& text, bool reversed, bool exactOnly,
                              uint64_t* bits) const {
  const size_t n = text.size();
  uint32_t at = 0;
  for (size_t i = 0;; ++i) {
    if (!exactOnly || i == n) {
      for (const uint32_t id : nodes[at].ends) {
        setBit(bits, id);
      }
    }
    if (i == n) {
      return;
    }
    const auto c = static_cast<unsigned char>(reversed ? text[n - 1 - i] : text[i]);
    const auto& children = nodes[at].children;
    const auto it =
        std::lower_bound(children.begin(), children.end(), c,
                         [](const auto& child, unsigned char key) { return child.first < key; });
    if (it == children.end() || it->first != c) {
      return;
    }
    at = it->second;
  }
}

void PatternIndex::FieldIndex::file(const Field& field, uint32_t id) {
  if (field.pattern == nullptr) {
    return;  // never matches
  }
  const _PARSE_INFO* list = field.list;
  const bool any = field.pattern[0] == '*' && field.pattern[1] == '\0';
  if (any || list == nullptr || !allAscii(list)) {
    setBit(always.data(), id);
    return;
  }
  const _PARSE_INFO* last = lastElement(list);
  if (list->matchType == NOWILD) {
    exact.insert(list->asciiFolded, strlen(list->asciiFolded), false, id);
  } else if (list->matchType == STARTSWITH) {
    prefix.insert(list->asciiFolded, strlen(list->asciiFolded), false, id);
  } else if (last->matchType == ENDSWITH && last->asciiFolded[0] != '\0') {
    suffix.insert(last->asciiFolded, strlen(last->asciiFolded), true, id);
  } else {
    setBit(always.data(), id);
  }
}

void PatternIndex::FieldIndex::mark(const std::string& folded, uint64_t* bits) const {
  std::copy(always.begin(), always.end(), bits);
  exact.mark(folded, false, true, bits);
  prefix.mark(folded, false, false, bits);
  suffix.mark(folded, true, false, bits);
}

void PatternIndex::build(const std::vector<std::pair<Field, Field>>& pairs) {
  size_ = pairs.size();
  words_ = (size_ + 63) / 64;
  for (int f = 0; f < 2; ++f) {
    fields_[f] = FieldIndex();
    fields_[f].always.assign(words_, 0);
    scratch_[f].assign(words_, 0);
  }
  for (size_t i = 0; i < pairs.size(); ++i) {
    fields_[0].file(pairs[i].first, static_cast<uint32_t>(i));
    fields_[1].file(pairs[i].second, static_cast<uint32_t>(i));
  }
}

bool PatternIndex::candidates(const char* first, const char* second, std::vector<uint32_t>* out) {
  out->clear();
  const char* texts[2] = {first, second};
  for (int f = 0; f < 2; ++f) {
    const size_t n = strlen(texts[f]);
    folded_[f].resize(n);
    if (!CCommon::foldAscii(texts[f], n, folded_[f].data())) {
      return false;
    }
    fields_[f].mark(folded_[f], scratch_[f].data());
  }
  for (size_t w = 0; w < words_; ++w) {
    uint64_t both = scratch_[0][w] & scratch_[1][w];
    while (both != 0) {
      out->push_back(static_cast<uint32_t>(w * 64 + static_cast<size_t>(__builtin_ctzll(both))));
      both &= both - 1;
    }
  }
  return true;
}
