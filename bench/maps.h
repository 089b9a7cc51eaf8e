/* The maps that are compared: ours and its peers, all with the same keys in the same order, each with
 * the means that it offers for nodes that are not to be allocated.
 *
 * Each has: find (null when the key is absent), iterate (a sum over all elements), insertAll and
 * removeAll (in the order of the keys' numbers), and takeOutAndIn, of one key by its number.
 */
#pragma once

#include <absl/container/btree_map.h>
#include <bsd/sys/tree.h>

#include <array>
#include <boost/intrusive/set.hpp>
#include <cstdlib>
#include <map>
#include <memory>
#include <vector>

#include "bench/our_map.h"

namespace bench {

/* A key as its two words, by which all maps order. */
struct Words {
  uint64_t first, second;
  bool operator<(const Words &other) const {
    return first != other.first ? first < other.first : second < other.second;
  }
};

inline Words wordsOf(const zel_UUID &uuid) {
  return {KARSTRBTreeWord(uuid.bytes), KARSTRBTreeWord(uuid.bytes + 8)};
}

/* From a key's words to its number; what the two maps of this kind look alike in. */
template <typename Map>
class NumberByWords {
 public:
  const uint32_t *find(const zel_UUID &uuid) const {
    const auto found = map_.find(wordsOf(uuid));
    return found == map_.end() ? nullptr : &found->second;
  }
  uint64_t iterate() const {
    uint64_t sum = 0;
    for (const auto &[words, number] : map_) sum += number;
    return sum;
  }

 protected:
  Map map_;
};

/* By node handles: like ours, without allocating. */
class StdMap : public NumberByWords<std::map<Words, uint32_t>> {
 public:
  explicit StdMap(const std::vector<zel_UUID> &keys) : outside_(keys.size()) {
    for (const zel_UUID &uuid : keys) {
      places_.push_back(map_.emplace(wordsOf(uuid), places_.size()).first);
    }
  }
  void insertAll() {
    for (size_t i = 0; i < outside_.size(); i++) {
      places_[i] = map_.insert(std::move(outside_[i])).position;
    }
  }
  void removeAll() {
    for (size_t i = 0; i < outside_.size(); i++) outside_[i] = map_.extract(places_[i]);
  }
  void takeOutAndIn(size_t number) {
    places_[number] = map_.insert(map_.extract(places_[number])).position;
  }

 private:
  std::vector<std::map<Words, uint32_t>::iterator> places_;
  std::vector<std::map<Words, uint32_t>::node_type> outside_;
};

/* `Unused` is what an element has more than it needs, between its links and its key. */
template <typename Unused>
class IntrusiveSetWith {
 public:
  explicit IntrusiveSetWith(const std::vector<zel_UUID> &keys) : elements_(keys.size()) {
    for (size_t i = 0; i < keys.size(); i++) {
      elements_[i].words = wordsOf(keys[i]);
      elements_[i].number = static_cast<uint32_t>(i);
    }
    insertAll();
  }
  const uint32_t *find(const zel_UUID &uuid) const {
    const auto found = set_.find(wordsOf(uuid));
    return found == set_.end() ? nullptr : &found->number;
  }
  uint64_t iterate() const {
    uint64_t sum = 0;
    for (const Element &element : set_) sum += element.number;
    return sum;
  }
  void insertAll() {
    for (Element &element : elements_) set_.insert(element);
  }
  void removeAll() {
    for (const Element &element : elements_) set_.erase(set_.iterator_to(element));
  }
  void takeOutAndIn(size_t number) {
    set_.erase(set_.iterator_to(elements_[number]));
    set_.insert(elements_[number]);
  }

 protected:
  struct Element : boost::intrusive::set_base_hook<
                       boost::intrusive::link_mode<boost::intrusive::normal_link>> {
    [[no_unique_address]] Unused unused;
    Words words;
    uint32_t number;
  };
  struct WordsOf {
    using type = Words;
    const Words &operator()(const Element &element) const { return element.words; }
  };

  std::vector<Element> elements_;
  boost::intrusive::set<Element, boost::intrusive::key_of_value<WordsOf>> set_;

 public:
  static constexpr size_t elementSize = sizeof(Element);
};

struct Nothing {};
using IntrusiveSet = IntrusiveSetWith<Nothing>;

/* The same with elements of as many bytes as ours: among a million, lines and pages are what counts. */
using LargerSet = IntrusiveSetWith<std::array<uint64_t, 2>>;
static_assert(LargerSet::elementSize == OurMap::elementSize);

/* That one with a call for each step, as a map of another module's is used: what a map in a library
 * cannot do without. */
class CalledSet : public LargerSet {
 public:
  using LargerSet::LargerSet;
  uint64_t iterate() const {
    uint64_t sum = 0;
    for (auto at = set_.begin(); at != set_.end(); at = next(at)) sum += at->number;
    return sum;
  }
  void takeOutAndIn(size_t number) {
    takeOut(elements_[number]);
    putIn(elements_[number]);
  }

 private:
  using Place = decltype(set_)::const_iterator;
  __attribute__((noinline)) static Place next(Place at) { return ++at; }
  __attribute__((noinline)) void takeOut(const Element &element) {
    set_.erase(set_.iterator_to(element));
  }
  __attribute__((noinline)) void putIn(Element &element) { set_.insert(element); }
};

struct BsdElement {
  RB_ENTRY(BsdElement) entry;
  Words words;
  uint32_t number;
};

inline int compare(const BsdElement *one, const BsdElement *other) {
  if (one->words.first != other->words.first) {
    return one->words.first < other->words.first ? -1 : 1;
  }
  return one->words.second < other->words.second ? -1 : one->words.second > other->words.second;
}

RB_HEAD(BsdTree, BsdElement);
RB_GENERATE_INTERNAL(BsdTree, BsdElement, entry, compare, [[maybe_unused]] static inline)

class BsdMap {
 public:
  explicit BsdMap(const std::vector<zel_UUID> &keys) : elements_(keys.size()) {
    RB_INIT(&tree_);
    for (size_t i = 0; i < keys.size(); i++) {
      elements_[i].words = wordsOf(keys[i]);
      elements_[i].number = static_cast<uint32_t>(i);
    }
    insertAll();
  }
  const uint32_t *find(const zel_UUID &uuid) const {
    BsdElement probe;
    probe.words = wordsOf(uuid);
    const BsdElement *const found = RB_FIND(BsdTree, &tree_, &probe);
    return found == nullptr ? nullptr : &found->number;
  }
  uint64_t iterate() const {
    uint64_t sum = 0;
    BsdElement *element;
    RB_FOREACH(element, BsdTree, &tree_) sum += element->number;
    return sum;
  }
  void insertAll() {
    for (BsdElement &element : elements_) RB_INSERT(BsdTree, &tree_, &element);
  }
  void removeAll() {
    for (BsdElement &element : elements_) RB_REMOVE(BsdTree, &tree_, &element);
  }
  void takeOutAndIn(size_t number) {
    RB_REMOVE(BsdTree, &tree_, &elements_[number]);
    RB_INSERT(BsdTree, &tree_, &elements_[number]);
  }

 private:
  std::vector<BsdElement> elements_;
  mutable BsdTree tree_; /* its macros know no const */
};

/* Its elements move: no node to keep, and it allocates. */
class BTree : public NumberByWords<absl::btree_map<Words, uint32_t>> {
 public:
  explicit BTree(const std::vector<zel_UUID> &keys) {
    for (const zel_UUID &uuid : keys) keys_.push_back(wordsOf(uuid));
    insertAll();
  }
  void insertAll() {
    for (size_t i = 0; i < keys_.size(); i++) insert(i);
  }
  void removeAll() {
    for (const Words &words : keys_) map_.erase(words);
  }
  void takeOutAndIn(size_t number) {
    map_.erase(keys_[number]);
    insert(number);
  }

 private:
  void insert(size_t number) { map_.emplace(keys_[number], static_cast<uint32_t>(number)); }

  std::vector<Words> keys_;
};

}  // namespace bench
