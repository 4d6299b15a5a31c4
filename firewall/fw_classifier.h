// The compiled classifier of the general rules: decision trees over five
// numeric fields that narrow the scan index (fw_index.h) to a few
// candidate slots per packet, plus a residual list of the rules no tree
// can separate.
//
// The ordered scan stays the definition. The tree only ever leaves out
// slots that would miss: each rule is projected on five dimensions, every
// projection an inclusive interval of 32-bit numbers that contains every
// value of a packet the rule can match:
//   0, 1  source, destination address: the IPv4 address, or the leading 32
//         bits of an IPv6 address (both families share the dimension; a
//         candidate of the wrong family is rejected by its slot);
//   2, 3  source, destination port;
//   4     IP protocol.
// A field the rule does not compare, negates, or (ports of a rule that
// compares the resource-pool tag) must not reject before the tag is read,
// projects on the whole dimension. A packet lacking a field may present
// any value for it: every rule comparing the field requires its presence,
// so its slot rejects the packet anyway, and every other rule spans the
// whole dimension.
//
// In large rulesets each rule goes to the tree of the dimension that
// separates it best (a long address prefix, else a port, else a shorter
// address, else the protocol), so that rules wide on one address do not
// get copied across every cut of a tree built on it; small ones have one
// tree (FWClassifierTuning). A node cuts an aligned power-of-two
// block of one dimension into 2^bits equal children; a rule goes to every
// child its projection meets, in ruleset order, so a leaf lists slot
// numbers in ascending order. Rules wide on every dimension would be
// copied into most leaves: they form the residual list instead, also
// ascending. A lookup merges the leaf of every tree and the residual list
// in ascending order, tests each slot (and the full test when the slot
// says so) and stops at the first match: the same rule, with the same
// tests run in the same order up to it, as the ordered scan.
//
// Memory comes from the module heap and is bounded per rule: when the
// bound would be passed, nodes stop being cut and their leaves just get
// longer. The build keeps one block: header, nodes, leaf lists, residual
// list.
#pragma once

#include "firewall/fw_rules.h"

inline constexpr uint32_t FW_CLS_DIMS = 5;

// Eight bytes, so that the levels of a descent below the shared top of
// the tree are more often still cached. A leaf keeps its count in the
// bytes an internal node keeps its cut in: up to FW_CLS_MAX_LEAF slots.
struct FWClsNode {
  uint32_t base;   // internal: first child node; leaf: first slot number in leaves
  uint8_t word;    // key word read (FWClsKey); FW_CLS_LEAF for a leaf
  uint8_t shift;   // internal: child = (word >> shift) & mask; leaf: count bits 16-23
  uint16_t mask;   // leaf: count bits 0-15
};
static_assert(sizeof(FWClsNode) == 8);
inline constexpr uint8_t FW_CLS_LEAF = 0xff;
inline constexpr uint32_t FW_CLS_MAX_LEAF = 0xffffff;

inline uint32_t FWClsLeafCount(const FWClsNode& n) {
  return n.mask | (static_cast<uint32_t>(n.shift) << 16);
}
inline FWClsNode FWClsLeafNode(uint32_t base, uint32_t count) {
  return FWClsNode{base, FW_CLS_LEAF, static_cast<uint8_t>(count >> 16),
                   static_cast<uint16_t>(count)};
}

inline constexpr uint32_t FW_CLS_TREES = FW_CLS_DIMS;

struct FWClassifier {
  uint32_t numTrees;             // trees that hold rules
  uint32_t roots[FW_CLS_TREES];  // the first numTrees: node number of each one's root
  uint32_t numRules;             // slots it was built for
  uint32_t numNodes;
  uint32_t numLeafSlots;
  uint32_t numResidual;
  uint32_t bytes;          // the whole block, for accounting
  const FWClsNode* nodes;  // inside this block
  // Slot numbers, inside this block: 16-bit ones (leaves16, residual16)
  // when numRules is at most FWClassifierTuning::maxRules16, which halves
  // what a lookup reads and keeps cached; else 32-bit ones. The other pair
  // is null.
  const uint32_t* leaves;
  const uint32_t* residual;
  const uint16_t* leaves16;
  const uint16_t* residual16;
};
inline constexpr uint32_t FW_CLS_MAX_SLOTS16 = 65536;  // slot numbers 0-65535

// Build limits. Rulesets smaller than minRules are scanned in order; a
// node with at most leafSize rules is a leaf (smallLeafSize, when not 0,
// for rulesets of at most smallRules rules: finer leaves test fewer
// candidates per packet, and only small rulesets build them fast enough);
// a cut may copy a node's rules into its children at most spaceFactor
// times over (children counted too), so that one cut never multiplies
// memory; the tree holds at most budgetPerRule 4-byte words (leaf
// entries; a node takes two) per rule. Rulesets of at most oneTreeRules
// rules put every rule the trees take in one tree: a lookup then descends
// once and merges nothing (but the residual list), and the copies of rules
// wide on the dimension cut stay affordable. Rulesets of at most
// maxRules16 rules (never above FW_CLS_MAX_SLOTS16) list 16-bit slot
// numbers. Tests lower them to exercise deep trees, and 32-bit slot
// numbers, on small rulesets.
struct FWClassifierTuning {
  uint32_t minRules;
  uint32_t leafSize;
  uint32_t maxDepth;
  uint32_t budgetPerRule;
  uint32_t smallLeafSize;
  uint32_t smallRules;
  uint32_t oneTreeRules;
  uint32_t spaceFactor;
  uint32_t maxRules16;
};
extern FWClassifierTuning g_fwClassifierTuning;
inline constexpr FWClassifierTuning kFWClassifierDefaults = {24,   16,    24, 256, 4,
                                                              4096, 16384, 12, FW_CLS_MAX_SLOTS16};

struct FWScanSlot;
struct FWRuleEntry;

// Builds the classifier of `count` slots (entries[i] belongs to slot i).
// Null and ZEL_OK when the ruleset is too small to gain from one (or, past
// FW_CLS_MAX_LEAF rules, too large for it).
// ZEL_NO_MEMORY when an allocation fails; nothing is then allocated.
[[nodiscard]] ZelStatus FWClassifierBuild(FWRuleEntry* const* entries, uint32_t count,
                                          FWClassifier** classifier);
void FWClassifierFree(FWClassifier** classifier);

// The packet's values on every dimension, packed as in the scan index's
// key words (fw_index.h) so that an IPv4 packet's words serve as they are:
// word 0 holds the ports (numeric) in bits 0-31 and the protocol in 32-39,
// word 1 the destination address in bits 0-31 and the source in 32-63.
// Other bits of word 0 are never read: a node's field stays inside its
// dimension.
struct FWClsKey {
  uint64_t w[2];
};
inline constexpr uint8_t kFWClsDimWord[FW_CLS_DIMS] = {1, 1, 0, 0, 0};
inline constexpr uint8_t kFWClsDimShift[FW_CLS_DIMS] = {32, 0, 16, 0, 32};

// The leaf node of `key` in the tree rooted at node `root`: its slot
// numbers start at `base` in leaves or leaves16, FWClsLeafCount of them.
inline const FWClsNode* FWClassifierLeaf(const FWClassifier* c, uint32_t root,
                                         const FWClsKey& key) {
  const FWClsNode* nodes = c->nodes;
  const FWClsNode* n = nodes + root;
  while (n->word != FW_CLS_LEAF) {
    n = &nodes[n->base + ((key.w[n->word] >> n->shift) & n->mask)];
  }
  return n;
}
