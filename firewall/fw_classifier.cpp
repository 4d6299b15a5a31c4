// Building the compiled classifier of the general rules (layout and
// meaning in fw_classifier.h). Reads only the entries it is given: called
// with configLock held exclusively, or on rules no packet sees yet. Every temporary comes from the module heap
// and is released before returning, on every path.

#include "firewall/fw_classifier.h"

#include "firewall/fw_index.h"

FWClassifierTuning g_fwClassifierTuning = kFWClassifierDefaults;

namespace {
constexpr uint32_t kDimBits[FW_CLS_DIMS] = {32, 32, 16, 16, 8};
constexpr uint32_t kMaxCutBits = 8;
// Lists longer than this choose their cut on a sample of this many rules.
constexpr uint32_t kSampleRules = 1024;
// A node costs two leaf entries (8 bytes against 4).
constexpr uint64_t kNodeCost = sizeof(FWClsNode) / sizeof(uint32_t);

// A rule's projection: inclusive intervals, numeric order.
struct Box {
  uint32_t lo[FW_CLS_DIMS];
  uint32_t hi[FW_CLS_DIMS];
};

// The aligned block [base, base + 2^width - 1] of one dimension.
struct Region {
  uint32_t base[FW_CLS_DIMS];
  uint8_t width[FW_CLS_DIMS];
};

inline uint64_t RegionHigh(const Region& r, uint32_t d) {
  return static_cast<uint64_t>(r.base[d]) + ((uint64_t{1} << r.width[d]) - 1);
}

// A growable array of trivially copyable T on the module heap.
template <typename T>
struct HeapArray {
  T* data = nullptr;
  uint32_t size = 0;
  uint32_t capacity = 0;

  HeapArray() = default;
  HeapArray(const HeapArray&) = delete;
  HeapArray& operator=(const HeapArray&) = delete;
  ~HeapArray() {
    if (data != nullptr) SLCGenericFree(data);
  }

  [[nodiscard]] bool Reserve(uint64_t want) {
    if (want <= capacity) return true;
    uint64_t cap = capacity == 0 ? 64 : capacity;
    while (cap < want) cap *= 2;
    if (cap * sizeof(T) > UINT32_MAX) return false;
    auto* grown = static_cast<T*>(SLCGenericAlloc(static_cast<uint32_t>(cap * sizeof(T))));
    if (grown == nullptr) return false;
    if (size != 0) zel_Memcpy(grown, data, static_cast<size_t>(size) * sizeof(T));
    if (data != nullptr) SLCGenericFree(data);
    data = grown;
    capacity = static_cast<uint32_t>(cap);
    return true;
  }
  [[nodiscard]] bool Push(const T& v) {
    if (size == capacity && !Reserve(uint64_t{size} + 1)) return false;
    data[size++] = v;
    return true;
  }
};

inline void Whole(Box* b, uint32_t d) {
  b->lo[d] = 0;
  b->hi[d] = static_cast<uint32_t>((uint64_t{1} << kDimBits[d]) - 1);
}

inline void Interval(Box* b, uint32_t d, uint32_t lo, uint32_t hi) {
  // An empty range matches nothing unless negated (and negated fields are
  // whole); whole is a safe over-approximation either way.
  if (lo > hi) {
    Whole(b, d);
    return;
  }
  b->lo[d] = lo;
  b->hi[d] = hi;
}

// See fw_classifier.h for what a projection must contain.
void Project(const FWRule& r, Box* b) {
  for (uint32_t d = 0; d < FW_CLS_DIMS; d++) Whole(b, d);
  const uint32_t f = r.ruleFlags;
  const uint32_t n = r.negateFlags;
  auto compared = [&](uint32_t wildcard, uint32_t negate) {
    return (f & wildcard) == 0 && (n & negate) == 0;
  };

  // A rule wildcarding both addresses matches either family: whole. A
  // rule comparing one only matches its family, whose leading 32 bits
  // (numeric) are the dimension; IPv6 ranges exclude their upper end,
  // so its leading bits are still an inclusive bound.
  if ((f & (FW_WC_IPSA | FW_WC_IPDA)) != (FW_WC_IPSA | FW_WC_IPDA)) {
    struct Addr {
      uint32_t wildcard, negate, range;
      const uint8_t *lo, *hi;
    };
    const Addr addrs[2] = {{FW_WC_IPSA, FW_NEG_IPSA, FW_RANGE_IPSA, r.ipSa, r.ipSaHigh},
                           {FW_WC_IPDA, FW_NEG_IPDA, FW_RANGE_IPDA, r.ipDa, r.ipDaHigh}};
    for (uint32_t d = 0; d < 2; d++) {
      const Addr& a = addrs[d];
      if (!compared(a.wildcard, a.negate)) continue;
      const uint32_t lo = FWNet32(a.lo);
      Interval(b, d, lo, (f & a.range) ? FWNet32(a.hi) : lo);
    }
  }

  // Ports: a rule comparing the pool tag must reach its tag test whatever
  // the ports (the tag is read exactly when a rule passes steps 1-8).
  if ((f & FW_WC_RPTAG) != 0) {
    if (compared(FW_WC_SPORT, FW_NEG_SPORT)) {
      const uint32_t lo = FWNet16(r.sPort);
      Interval(b, 2, lo, (f & FW_RANGE_SPORT) ? FWNet16(r.sPortHigh) : lo);
    }
    if (compared(FW_WC_DPORT, FW_NEG_DPORT)) {
      const uint32_t lo = FWNet16(r.dPort);
      Interval(b, 3, lo, (f & FW_RANGE_DPORT) ? FWNet16(r.dPortHigh) : lo);
    }
  }
  if (compared(FW_WC_IPPROTO, FW_NEG_IPPROTO)) Interval(b, 4, r.ipProto, r.ipProto);
}

// The tree a rule goes to, or FW_CLS_TREES for the residual list. Widths
// are compared as fractions of their dimension.
uint32_t TreeOf(const Box& b) {
  uint64_t width[FW_CLS_DIMS];
  for (uint32_t d = 0; d < FW_CLS_DIMS; d++) {
    width[d] = (static_cast<uint64_t>(b.hi[d]) - b.lo[d]) << (32 - kDimBits[d]);
  }
  constexpr uint64_t kLongPrefix = uint64_t{1} << 16;  // a /16 or longer
  constexpr uint64_t kNarrow = uint64_t{1} << 28;      // a sixteenth or less
  const uint32_t addr = width[1] < width[0] ? 1 : 0;
  const uint32_t port = width[3] < width[2] ? 3 : 2;
  if (width[addr] < kLongPrefix) return addr;
  if (width[port] < kNarrow) return port;
  if (width[addr] < kNarrow) return addr;
  if (width[4] < kNarrow) return 4;
  return FW_CLS_TREES;
}

struct Builder {
  const Box* boxes;
  uint32_t leafSize;
  HeapArray<FWClsNode> nodes;
  HeapArray<uint32_t> leaves;
  HeapArray<uint32_t> scratch;  // rule lists of the nodes being built, as a stack
  HeapArray<uint32_t> counts;   // per child, 2^kMaxCutBits + 1
  HeapArray<uint32_t> spans;    // two per rule of the node being cut
  HeapArray<uint32_t> offsets;  // where each child's list starts, per node being built

  [[nodiscard]] bool MakeLeaf(uint32_t node, uint32_t off, uint32_t count) {
    if (!leaves.Reserve(uint64_t{leaves.size} + count)) return false;
    const uint32_t base = leaves.size;
    if (count != 0) {
      zel_Memcpy(leaves.data + base, scratch.data + off, static_cast<size_t>(count) * 4);
    }
    leaves.size += count;
    nodes.data[node] = FWClsLeafNode(base, count);
    return true;
  }

  // The children rule `i` meets when dimension d of `reg` is cut into
  // 2^bits: [*first, *last].
  void ChildSpan(uint32_t i, const Region& reg, uint32_t d, uint32_t bits, uint32_t* first,
                 uint32_t* last) const {
    const uint32_t shift = reg.width[d] - bits;
    const uint64_t lo = boxes[i].lo[d] > reg.base[d] ? boxes[i].lo[d] : reg.base[d];
    const uint64_t regHi = RegionHigh(reg, d);
    const uint64_t hi = boxes[i].hi[d] < regHi ? boxes[i].hi[d] : regHi;
    *first = static_cast<uint32_t>((lo - reg.base[d]) >> shift);
    *last = static_cast<uint32_t>((hi - reg.base[d]) >> shift);
  }

  // The children every stride-th rule of the list meets when dimension d
  // of `reg` is cut into 2^bits: pairs (first, last) in spans. Returns the
  // rules sampled.
  uint32_t Spans(uint32_t off, uint32_t count, uint32_t stride, const Region& reg, uint32_t d,
                 uint32_t bits) {
    uint32_t sampled = 0;
    for (uint32_t k = 0; k < count; k += stride, sampled++) {
      ChildSpan(scratch.data[off + k], reg, d, bits, &spans.data[2 * sampled],
                &spans.data[2 * sampled + 1]);
    }
    return sampled;
  }

  // The largest child and the copies of the cut into 2^bits children whose
  // spans, `shift` bits finer, Spans left, scaled from `sampled` rules to
  // `count`.
  void Evaluate(uint32_t sampled, uint32_t count, uint32_t bits, uint32_t shift,
                uint64_t* largest, uint64_t* copies) {
    const uint32_t children = 1u << bits;
    uint32_t* c = counts.data;
    zel_Memset(c, 0, (children + 1) * sizeof(uint32_t));
    uint64_t total = 0;
    const uint32_t* span = spans.data;
    for (uint32_t k = 0; k < sampled; k++) {
      const uint32_t first = span[2 * k] >> shift, last = span[2 * k + 1] >> shift;
      c[first]++;
      c[last + 1]--;
      total += last - first + 1;
    }
    uint32_t running = 0, most = 0;
    for (uint32_t j = 0; j < children; j++) {
      running += c[j];
      if (running > most) most = running;
    }
    *largest = uint64_t{most} * count / sampled;
    *copies = total * count / sampled;
  }

  // Builds node `node` for the rules scratch[off, off + count) in region
  // `reg`, spending at most `budget` leaf entries (nodes at kNodeCost) on
  // the subtree; at least `count`, what a leaf takes. A cut keeps enough
  // for every child to be a leaf and shares the rest in proportion to the
  // children's rules, so the bound holds however the tree grows. The
  // children's lists go on top of the scratch stack and are gone when it
  // returns. False when memory ran out.
  [[nodiscard]] bool Build(uint32_t node, uint32_t off, uint32_t count, const Region& reg,
                           uint32_t depth, uint64_t budget) {
    const FWClassifierTuning& t = g_fwClassifierTuning;
    if (count <= leafSize || depth >= t.maxDepth) {
      return MakeLeaf(node, off, count);
    }
    // The cut that leaves the smallest largest child within the space
    // factor; fewer copies break ties between dimensions. Large lists are
    // judged on a sample; the cut taken is then counted exactly.
    const uint32_t stride = count > kSampleRules ? count / kSampleRules : 1;
    uint32_t bestDim = FW_CLS_DIMS, bestBits = 0;
    uint64_t bestLargest = count, bestCopies = 0;
    // Cuts into more than about four children per rule are not tried.
    const uint32_t countBits = 33 - static_cast<uint32_t>(__builtin_clz(count));
    const uint32_t bitsCap = countBits < kMaxCutBits ? countBits : kMaxCutBits;
    for (uint32_t d = 0; d < FW_CLS_DIMS; d++) {
      const uint32_t maxBits = reg.width[d] < bitsCap ? reg.width[d] : bitsCap;
      if (maxBits == 0) continue;
      const uint32_t sampled = Spans(off, count, stride, reg, d, maxBits);
      // The finest cut within the space factor (1 bit at least): a finer
      // cut copies at least as much and never leaves a larger largest
      // child, so a bisection finds the dimension's best.
      uint32_t lo = 1, hi = maxBits, bits = 0;
      uint64_t largest = 0, copies = 0;
      while (lo <= hi) {
        const uint32_t mid = (lo + hi) / 2;
        uint64_t l, c;
        Evaluate(sampled, count, mid, maxBits - mid, &l, &c);
        if (c + (1u << mid) <= uint64_t{t.spaceFactor} * count || mid == 1) {
          bits = mid, largest = l, copies = c;
          lo = mid + 1;
        } else {
          hi = mid - 1;
        }
      }
      if (largest < bestLargest || (largest == bestLargest && bestDim != FW_CLS_DIMS &&
                                    copies < bestCopies)) {
        bestDim = d;
        bestBits = bits;
        bestLargest = largest;
        bestCopies = copies;
      }
    }
    if (bestDim == FW_CLS_DIMS) return MakeLeaf(node, off, count);
    const uint32_t d = bestDim;

    // Each child's rules, counted exactly: every rule's span at the chosen
    // cut, then the same evaluation as the sample's. The starts of the
    // children's lists (relative to `fill`) go on the offsets stack. Only
    // a cut whose every child holds fewer rules than this node is taken
    // (sibling subtrees are shared on that ground, below), within the
    // space factor and the budget. The sample may have misjudged the cut:
    // coarser cuts of the same dimension are tried before the node gives
    // up.
    const uint32_t at = offsets.size;
    if (!offsets.Reserve(uint64_t{at} + (1u << bestBits) + 1)) return false;
    const uint32_t spanBits = bestBits;
    Spans(off, count, 1, reg, d, spanBits);
    uint32_t* c = counts.data;
    uint32_t children = 0;
    uint64_t copies = 0;
    for (;; bestBits--) {
      uint64_t largest;
      Evaluate(count, count, bestBits, spanBits - bestBits, &largest, &copies);
      children = 1u << bestBits;
      if (largest < count && (copies + children <= uint64_t{t.spaceFactor} * count || bestBits == 1) &&
          children * kNodeCost + copies <= budget) {
        break;
      }
      if (bestBits == 1) return MakeLeaf(node, off, count);
    }
    uint32_t running = 0, start = 0;
    for (uint32_t j = 0; j < children; j++) {
      running += c[j];
      offsets.data[at + j] = start;
      c[j] = start;  // from here on, where child j's next rule goes
      start += running;
    }
    offsets.data[at + children] = start;
    const uint64_t share = budget - children * kNodeCost;
    const uint32_t fill = scratch.size;
    if (!scratch.Reserve(uint64_t{fill} + copies) || !nodes.Reserve(uint64_t{nodes.size} + children)) {
      return false;
    }
    offsets.size = at + children + 1;
    scratch.size = fill + static_cast<uint32_t>(copies);
    const uint32_t spanShift = spanBits - bestBits;
    for (uint32_t k = 0; k < count; k++) {
      const uint32_t i = scratch.data[off + k];
      const uint32_t first = spans.data[2 * k] >> spanShift, last = spans.data[2 * k + 1] >> spanShift;
      for (uint32_t j = first; j <= last; j++) scratch.data[fill + c[j]++] = i;
    }

    const uint32_t childBase = nodes.size;
    nodes.size += children;
    const uint32_t shift = reg.width[d] - bestBits;
    nodes.data[node] = FWClsNode{childBase, kFWClsDimWord[d],
                                 static_cast<uint8_t>(kFWClsDimShift[d] + shift),
                                 static_cast<uint16_t>(children - 1)};

    Region sub = reg;
    sub.width[d] = static_cast<uint8_t>(shift);
    for (uint32_t j = 0; j < children; j++) {
      sub.base[d] = reg.base[d] + static_cast<uint32_t>(uint64_t{j} << shift);
      const uint32_t curOff = fill + offsets.data[at + j];
      const uint32_t curCount = offsets.data[at + j + 1] - offsets.data[at + j];
      // Siblings with the same rules get one subtree. It serves both
      // because it never cuts d again: every rule of the list meets both
      // siblings, so contains the last value of the previous one, and a
      // cut of d anywhere below would leave one child with all the rules,
      // which a cut must improve on. Cuts of other dimensions see the
      // same projections in both siblings.
      if (j != 0) {
        const uint32_t prevOff = fill + offsets.data[at + j - 1];
        const uint32_t prevCount = offsets.data[at + j] - offsets.data[at + j - 1];
        if (prevCount == curCount &&
            (curCount == 0 ||
             zel_Memcmp(scratch.data + prevOff, scratch.data + curOff, curCount * 4) == 0)) {
          nodes.data[childBase + j] = nodes.data[childBase + j - 1];
          continue;
        }
      }
      const uint64_t childBudget = copies == 0 ? 0 : share * curCount / copies;
      if (!Build(childBase + j, curOff, curCount, sub, depth + 1,
                 childBudget > curCount ? childBudget : curCount)) {
        return false;
      }
    }
    offsets.size = at;
    scratch.size = fill;
    return true;
  }
};

}  // namespace

namespace {

// Builds the classifier of `count` rules whose projections fill `boxes`
// (already filled; released by the caller).
ZelStatus BuildFromBoxes(Box* boxes, uint32_t count, FWClassifier** classifier) {
  ZelStatus status = ZEL_NO_MEMORY;
  {
    Builder b;
    b.boxes = boxes;
    const FWClassifierTuning& t = g_fwClassifierTuning;
    b.leafSize = count <= t.smallRules && t.smallLeafSize != 0 ? t.smallLeafSize : t.leafSize;
    HeapArray<uint32_t> residual;
    auto* tree = static_cast<uint8_t*>(SLCGenericAlloc(count));
    bool ok = tree != nullptr && b.counts.Reserve((1u << kMaxCutBits) + 1) &&
              b.spans.Reserve(2 * uint64_t{count}) &&
              b.scratch.Reserve(count);
    uint32_t members[FW_CLS_TREES] = {};
    for (uint32_t i = 0; ok && i < count; i++) {
      tree[i] = static_cast<uint8_t>(TreeOf(boxes[i]));
      if (tree[i] != FW_CLS_TREES && count <= t.oneTreeRules) tree[i] = 0;
      if (tree[i] == FW_CLS_TREES) {
        ok = residual.Push(i);
      } else {
        members[tree[i]]++;
      }
    }
    Region root;
    for (uint32_t d = 0; d < FW_CLS_DIMS; d++) {
      root.base[d] = 0;
      root.width[d] = static_cast<uint8_t>(kDimBits[d]);
    }
    uint32_t roots[FW_CLS_TREES];
    uint32_t numTrees = 0;
    for (uint32_t t = 0; t < FW_CLS_TREES; t++) {
      if (!ok || members[t] == 0) continue;
      b.scratch.size = 0;
      for (uint32_t i = 0; i < count; i++) {
        if (tree[i] == t) b.scratch.data[b.scratch.size++] = i;
      }
      // Each tree's share of the bound is that of its rules.
      const uint64_t budget = uint64_t{members[t]} * g_fwClassifierTuning.budgetPerRule;
      const uint32_t at = b.nodes.size;
      roots[numTrees++] = at;
      ok = b.nodes.Push(FWClsNode{}) &&
           b.Build(at, 0, b.scratch.size, root, 0,
                   budget > members[t] ? budget : members[t]);
    }
    if (tree != nullptr) SLCGenericFree(tree);

    if (ok) {
      const bool narrow = count <= FW_CLS_MAX_SLOTS16 && count <= t.maxRules16;
      const uint64_t bytes = sizeof(FWClassifier) + uint64_t{b.nodes.size} * sizeof(FWClsNode) +
                             (uint64_t{b.leaves.size} + residual.size) *
                                 (narrow ? sizeof(uint16_t) : sizeof(uint32_t));
      void* block = bytes > UINT32_MAX ? nullptr : SLCGenericAlloc(static_cast<uint32_t>(bytes));
      if (block != nullptr) {
        auto* c = static_cast<FWClassifier*>(block);
        auto* nodes = reinterpret_cast<FWClsNode*>(c + 1);
        zel_Memcpy(nodes, b.nodes.data, static_cast<size_t>(b.nodes.size) * sizeof(FWClsNode));
        c->leaves = c->residual = nullptr;
        c->leaves16 = c->residual16 = nullptr;
        if (narrow) {
          auto* leaves = reinterpret_cast<uint16_t*>(nodes + b.nodes.size);
          auto* rest = leaves + b.leaves.size;
          for (uint32_t k = 0; k < b.leaves.size; k++) leaves[k] = static_cast<uint16_t>(b.leaves.data[k]);
          for (uint32_t k = 0; k < residual.size; k++) rest[k] = static_cast<uint16_t>(residual.data[k]);
          c->leaves16 = leaves;
          c->residual16 = rest;
        } else {
          auto* leaves = reinterpret_cast<uint32_t*>(nodes + b.nodes.size);
          auto* rest = leaves + b.leaves.size;
          if (b.leaves.size != 0) {
            zel_Memcpy(leaves, b.leaves.data, static_cast<size_t>(b.leaves.size) * 4);
          }
          if (residual.size != 0) {
            zel_Memcpy(rest, residual.data, static_cast<size_t>(residual.size) * 4);
          }
          c->leaves = leaves;
          c->residual = rest;
        }
        c->numTrees = numTrees;
        for (uint32_t t = 0; t < numTrees; t++) c->roots[t] = roots[t];
        c->numRules = count;
        c->numNodes = b.nodes.size;
        c->numLeafSlots = b.leaves.size;
        c->numResidual = residual.size;
        c->bytes = static_cast<uint32_t>(bytes);
        c->nodes = nodes;
        *classifier = c;
        status = ZEL_OK;
      }
    }
  }
  return status;
}

// The rules' projections, in a block of the module heap; null when it
// cannot be had.
Box* AllocBoxes(uint32_t count) {
  const uint64_t bytes = uint64_t{count} * sizeof(Box);
  if (count == 0 || bytes > UINT32_MAX) return nullptr;
  return static_cast<Box*>(SLCGenericAlloc(static_cast<uint32_t>(bytes)));
}

}  // namespace

ZelStatus FWClassifierBuild(FWRuleEntry* const* entries, uint32_t count,
                            FWClassifier** classifier) {
  *classifier = nullptr;
  // Beyond FW_CLS_MAX_LEAF rules a leaf might not say its count; such
  // rulesets (gigabytes of rules) are scanned in order.
  if (count < g_fwClassifierTuning.minRules || count == 0 || count > FW_CLS_MAX_LEAF) {
    return ZEL_OK;
  }
  Box* boxes = AllocBoxes(count);
  if (boxes == nullptr) return ZEL_NO_MEMORY;
  for (uint32_t i = 0; i < count; i++) Project(entries[i]->rule, &boxes[i]);
  const ZelStatus status = BuildFromBoxes(boxes, count, classifier);
  SLCGenericFree(boxes);
  return status;
}

void FWClassifierFree(FWClassifier** classifier) {
  if (*classifier != nullptr) {
    SLCGenericFree(*classifier);
    *classifier = nullptr;
  }
}
