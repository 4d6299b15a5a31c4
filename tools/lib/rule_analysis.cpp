// Coverage between rules, lint findings and rule-level diffs.

#include "tools/lib/rule_analysis.h"

#include <cstring>
#include <map>
#include <deque>

namespace rules {

namespace {

using U128 = unsigned __int128;

U128 Value(const uint8_t* p, int n) {
  U128 v = 0;
  for (int i = 0; i < n; i++) v = (v << 8) | p[i];
  return v;
}

// A set of values of one field: the interval [lo, hi] (empty when lo > hi)
// or, negated, everything in [0, max] outside it.
struct Interval {
  U128 lo, hi;
  bool neg;
};

// The pieces of a set as plain intervals (at most two).
int Pieces(const Interval& s, U128 max, Interval out[2]) {
  const bool empty = s.lo > s.hi;
  if (!s.neg) {
    if (empty) return 0;
    out[0] = {s.lo, s.hi, false};
    return 1;
  }
  if (empty) {
    out[0] = {0, max, false};
    return 1;
  }
  int n = 0;
  if (s.lo > 0) out[n++] = {0, s.lo - 1, false};
  if (s.hi < max) out[n++] = {s.hi + 1, max, false};
  return n;
}

bool IntervalSubset(const Interval& inner, const Interval& outer, U128 max) {
  Interval in[2], out[2];
  const int ni = Pieces(inner, max, in), no = Pieces(outer, max, out);
  for (int i = 0; i < ni; i++) {
    bool inside = false;
    for (int o = 0; o < no; o++) inside = inside || (out[o].lo <= in[i].lo && in[i].hi <= out[o].hi);
    if (!inside) return false;
  }
  return true;
}

// {x : (x & mask) == (value & mask)}, or its complement.
struct Masked {
  uint64_t value, mask;
  bool neg;
};

bool MaskedSubset(const Masked& in, const Masked& out) {
  if (in.neg && in.mask == 0) return true;  // matches nothing
  if (!in.neg && !out.neg) return (out.mask & ~in.mask) == 0 && ((in.value ^ out.value) & out.mask) == 0;
  if (in.neg && out.neg) return (in.mask & ~out.mask) == 0 && ((in.value ^ out.value) & in.mask) == 0;
  if (!in.neg && out.neg) return ((in.value ^ out.value) & in.mask & out.mask) != 0;
  return out.mask == 0;
}

uint64_t Mac48(const uint8_t* m) { return static_cast<uint64_t>(Value(m, 6)); }

bool Exact(const FWRule& r) { return IsExactRule(r); }

// Negation only counts for general rules.
bool Neg(const FWRule& r, uint32_t bit) { return !Exact(r) && (r.negateFlags & bit) != 0; }

Masked MacSet(const FWRule& r, bool dst) {
  const uint32_t maskBit = dst ? FW_MASK_DMAC : FW_MASK_SMAC;
  const uint64_t mask = (r.ruleFlags & maskBit) ? Mac48(dst ? r.dMacMask : r.sMacMask) : 0xffffffffffffULL;
  return {Mac48(dst ? r.dMac : r.sMac) & mask, mask, Neg(r, dst ? FW_NEG_DMAC : FW_NEG_SMAC)};
}

Interval AddrSet(const FWRule& r, bool src) {
  const bool v4 = (r.ruleFlags & FW_FLAG_IPV4) != 0;
  const int n = v4 ? 4 : 16;
  const uint8_t* lo = src ? r.ipSa : r.ipDa;
  const uint8_t* hi = src ? r.ipSaHigh : r.ipDaHigh;
  const bool neg = Neg(r, src ? FW_NEG_IPSA : FW_NEG_IPDA);
  const U128 l = Value(lo, n);
  if (!(r.ruleFlags & (src ? FW_RANGE_IPSA : FW_RANGE_IPDA))) return {l, l, neg};
  U128 h = Value(hi, n);
  if (!v4) {
    if (h == 0) return {1, 0, neg};  // the upper bound is excluded: empty
    h -= 1;
  }
  return {l, h, neg};
}

Interval PortSet(const FWRule& r, bool src) {
  const uint16_t lo = FWNet16(src ? r.sPort : r.dPort);
  const uint16_t hi = FWNet16(src ? r.sPortHigh : r.dPortHigh);
  const bool neg = Neg(r, src ? FW_NEG_SPORT : FW_NEG_DPORT);
  if (!(r.ruleFlags & (src ? FW_RANGE_SPORT : FW_RANGE_DPORT))) return {lo, lo, neg};
  return {lo, hi, neg};
}

Interval PointSet(U128 v, bool neg) { return {v, v, neg}; }

}  // namespace

bool SameTuple(const FWRule& a, const FWRule& b) {
  if ((a.ruleFlags & FW_FLAG_IPV4) != (b.ruleFlags & FW_FLAG_IPV4)) return false;
  const int n = (a.ruleFlags & FW_FLAG_IPV4) ? 4 : 16;
  return std::memcmp(a.dMac, b.dMac, 6) == 0 && std::memcmp(a.sMac, b.sMac, 6) == 0 &&
         std::memcmp(a.ethType, b.ethType, 2) == 0 && std::memcmp(a.vlan1QTag, b.vlan1QTag, 4) == 0 &&
         std::memcmp(a.ipSa, b.ipSa, n) == 0 && std::memcmp(a.ipDa, b.ipDa, n) == 0 &&
         a.ipProto == b.ipProto && std::memcmp(a.sPort, b.sPort, 2) == 0 &&
         std::memcmp(a.dPort, b.dPort, 2) == 0;
}

FWRule MirrorOf(const FWRule& r) {
  FWRule m = r;
  std::memcpy(m.dMac, r.sMac, 6);
  std::memcpy(m.sMac, r.dMac, 6);
  const int n = (r.ruleFlags & FW_FLAG_IPV4) ? 4 : 16;
  std::memcpy(m.ipSa, r.ipDa, n);
  std::memcpy(m.ipDa, r.ipSa, n);
  std::memcpy(m.sPort, r.dPort, 2);
  std::memcpy(m.dPort, r.sPort, 2);
  m.bidirectional = 2;
  if (r.direction == 1) m.direction = 2;
  if (r.direction == 2) m.direction = 1;
  return m;
}

bool Covers(const FWRule& outer, const FWRule& inner) {
  const uint32_t fo = outer.ruleFlags, fi = inner.ruleFlags;
  if (inner.direction == SLCGenericDirectionInvalid) return true;  // matches nothing
  if (outer.direction != SLCGenericDirectionBidirectional && outer.direction != inner.direction) {
    return false;
  }
  if (!(fo & FW_WC_RPTAG) && ((fi & FW_WC_RPTAG) || inner.rpTag != outer.rpTag)) return false;
  // Every field the outer rule tests must be tested by the inner rule, on a
  // subset of the outer rule's values.
  for (uint32_t bit = FW_WC_DMAC; bit <= FW_WC_DPORT; bit <<= 1) {
    if (!(fo & bit) && (fi & bit)) return false;
  }
  // Addresses also pin the family.
  const bool outerAddr = !(fo & FW_WC_IPSA) || !(fo & FW_WC_IPDA);
  if (outerAddr && (fo & FW_FLAG_IPV4) != (fi & FW_FLAG_IPV4)) return false;
  if (!(fo & FW_WC_DMAC) && !MaskedSubset(MacSet(inner, true), MacSet(outer, true))) return false;
  if (!(fo & FW_WC_SMAC) && !MaskedSubset(MacSet(inner, false), MacSet(outer, false))) return false;
  if (!(fo & FW_WC_ETHTYPE) &&
      !IntervalSubset(PointSet(FWNet16(inner.ethType), Neg(inner, FW_NEG_ETHTYPE)),
                      PointSet(FWNet16(outer.ethType), Neg(outer, FW_NEG_ETHTYPE)), 0xffff)) {
    return false;
  }
  if (!(fo & FW_WC_VLAN) &&
      !IntervalSubset(PointSet(FWNet32(inner.vlan1QTag), Neg(inner, FW_NEG_VLAN)),
                      PointSet(FWNet32(outer.vlan1QTag), Neg(outer, FW_NEG_VLAN)), 0xffffffffu)) {
    return false;
  }
  const U128 addrMax = (fo & FW_FLAG_IPV4) ? U128{0xffffffffu} : ~U128{0};
  if (!(fo & FW_WC_IPSA) && !IntervalSubset(AddrSet(inner, true), AddrSet(outer, true), addrMax)) return false;
  if (!(fo & FW_WC_IPDA) && !IntervalSubset(AddrSet(inner, false), AddrSet(outer, false), addrMax)) return false;
  if (!(fo & FW_WC_IPPROTO) &&
      !IntervalSubset(PointSet(inner.ipProto, Neg(inner, FW_NEG_IPPROTO)),
                      PointSet(outer.ipProto, Neg(outer, FW_NEG_IPPROTO)), 0xff)) {
    return false;
  }
  if (!(fo & FW_WC_SPORT) && !IntervalSubset(PortSet(inner, true), PortSet(outer, true), 0xffff)) return false;
  if (!(fo & FW_WC_DPORT) && !IntervalSubset(PortSet(inner, false), PortSet(outer, false), 0xffff)) return false;
  return true;
}

std::vector<Finding> Lint(const RulesetText& text) {
  std::vector<Finding> out;
  const std::vector<TextRule>& rs = text.rules;
  // Pairwise checks are quadratic; past this many rules only the per-rule
  // checks run.
  constexpr size_t kPairLimit = 5000;
  const bool pairs = rs.size() <= kPairLimit;
  if (!pairs) {
    out.push_back({0, 0,
                   "more than " + std::to_string(kPairLimit) +
                       " rules: rules hidden by other rules are not looked for"});
  }
  auto name = [](const TextRule& t) { return "line " + std::to_string(t.line); };
  for (size_t i = 0; i < rs.size(); i++) {
    const FWRule& r = rs[i].rule;
    const bool exact = IsExactRule(r);
    if (r.direction == SLCGenericDirectionInvalid) {
      out.push_back({rs[i].line, 0, "dir=invalid: the rule never matches"});
      continue;
    }
    if (!exact && r.bidirectional != 0) {
      out.push_back({rs[i].line, 0,
                     "bidir has no effect on a general rule: only exact rules get a mirrored half"});
    }
    if (exact && r.ipProto != 6 && r.ipProto != 17) {
      out.push_back({rs[i].line, 0,
                     "exact rule for protocol " + std::to_string(r.ipProto) +
                         ": exact rules only match TCP and UDP, so it never matches"});
    }
    if (!pairs) continue;
    bool reported = false;
    for (size_t j = 0; j < rs.size() && !reported; j++) {
      if (j == i) continue;
      const FWRule& o = rs[j].rule;
      const bool oExact = IsExactRule(o);
      if (exact && oExact && j < i) {
        const bool direct = SameTuple(o, r);
        const bool mirrored = !direct && o.bidirectional == 1 && SameTuple(MirrorOf(o), r);
        if (direct || mirrored) {
          const FWRule& base = direct ? o : MirrorOf(o);
          std::string msg = std::string("same tuple as ") + (mirrored ? "the mirrored half of " : "") +
                            name(rs[j]) + ": the exact rules merge into one entry with " + name(rs[j]) +
                            "'s action (" + ActionName(o.action) + ")";
          if (base.direction != r.direction) msg += ", matching both directions";
          if (o.action != r.action) msg += "; this rule's action " + ActionName(r.action) + " is never used";
          out.push_back({rs[i].line, rs[j].line, msg});
          reported = true;
        } else if (r.bidirectional == 1 && SameTuple(MirrorOf(r), o) && o.action != r.action) {
          out.push_back({rs[i].line, rs[j].line,
                         "its mirrored half has the same tuple as " + name(rs[j]) +
                             " and merges into it: the replies get " + name(rs[j]) + "'s action (" +
                             ActionName(o.action) + "), not " + ActionName(r.action)});
          reported = true;
        }
      } else if (!exact && oExact) {
        const bool mirrored = o.bidirectional == 1 && Covers(MirrorOf(o), r);
        if (Covers(o, r) || mirrored) {
          out.push_back({rs[i].line, rs[j].line,
                         "never matches: every packet it would match hits the exact rule at " +
                             name(rs[j]) + (mirrored ? " (its mirrored half)" : "") +
                             ", which is probed before any general rule"});
          reported = true;
        }
      } else if (!exact && !oExact && j < i && Covers(o, r)) {
        std::string msg = "never matches: the earlier general rule at " + name(rs[j]) +
                          " matches every packet it would";
        if (o.action != r.action) {
          msg += ", with a different action (" + ActionName(o.action) + " instead of " +
                 ActionName(r.action) + ")";
        }
        out.push_back({rs[i].line, rs[j].line, msg});
        reported = true;
      }
    }
  }
  return out;
}

namespace {

// The part of a rule that says what it matches.
std::string MatchKey(const FWRule& r, uint8_t version) {
  FWRule k = r;
  k.action = SLCGenericActionNone;
  k.bidirectional = 0;
  std::memset(k.rewriteMac, 0, sizeof(k.rewriteMac));
  std::memset(k.greIP, 0, sizeof(k.greIP));
  k.snapLen = 0;
  std::memset(k.resourcePool, 0, sizeof(k.resourcePool));
  k.dscpTag = 0;
  k.ethDot1PTag = 0;
  k.pktCount = 0;
  k.byteCount = 0;
  if (version == FW_RULESET_VERSION_7) k.ruleFlags |= FW_WC_RPTAG;
  return std::string(reinterpret_cast<const char*>(&k), sizeof(k));
}

std::string Text(const FWRule& r, uint8_t version) {
  FWRule c = r;
  c.pktCount = 0;
  c.byteCount = 0;
  return FormatRule(c, version);
}

}  // namespace

std::vector<RuleChange> DiffRules(const RulesetText& a, const RulesetText& b) {
  std::vector<RuleChange> out;
  auto header = [](const RulesetText& t) {
    return "ruleset version=" + std::to_string(t.version) + " features=" + FeatureNames(t.features) +
           " frag=" + ActionName(t.fragOverride);
  };
  if (header(a) != header(b)) out.push_back({RuleChange::kChanged, 0, 0, header(a), header(b)});
  // Identical rules pair first, so a rule that only moved is no change;
  // what is left pairs by what it matches.
  std::vector<bool> paired(a.rules.size(), false), pairedNew(b.rules.size(), false);
  std::vector<size_t> partner(b.rules.size(), 0);
  for (int pass = 0; pass < 2; pass++) {
    std::map<std::string, std::deque<size_t>> olds;
    auto key = [&](const FWRule& r, uint8_t v) { return pass == 0 ? Text(r, v) : MatchKey(r, v); };
    for (size_t i = 0; i < a.rules.size(); i++) {
      if (!paired[i]) olds[key(a.rules[i].rule, a.version)].push_back(i);
    }
    for (size_t n = 0; n < b.rules.size(); n++) {
      if (pairedNew[n]) continue;
      auto it = olds.find(key(b.rules[n].rule, b.version));
      if (it == olds.end() || it->second.empty()) continue;
      partner[n] = it->second.front();
      it->second.pop_front();
      paired[partner[n]] = true;
      pairedNew[n] = true;
    }
  }
  std::vector<RuleChange> news;
  for (size_t n = 0; n < b.rules.size(); n++) {
    const TextRule& nr = b.rules[n];
    const std::string nt = Text(nr.rule, b.version);
    if (!pairedNew[n]) {
      news.push_back({RuleChange::kAdded, 0, nr.line, "", nt});
      continue;
    }
    const std::string ot = Text(a.rules[partner[n]].rule, a.version);
    if (ot != nt) news.push_back({RuleChange::kChanged, a.rules[partner[n]].line, nr.line, ot, nt});
  }
  for (size_t i = 0; i < a.rules.size(); i++) {
    if (!paired[i]) out.push_back({RuleChange::kRemoved, a.rules[i].line, 0, Text(a.rules[i].rule, a.version), ""});
  }
  out.insert(out.end(), news.begin(), news.end());
  return out;
}

}  // namespace rules
