// Applying a ruleset to a filter, exporting a filter's rules as a ruleset,
// and clearing them.
//
// Applying is all or nothing, in two ways:
//   - replace: the new rules are built whole in a staging context of their
//     own (table, general list, scan index with its classifier), which
//     needs none of the former rules and so no lock: FWReplaceRuleset
//     builds it before taking configLock exclusively, and the hold only
//     swaps the staged rules with those in force (no allocation, nothing
//     can fail). The former rules are released after the hold. A failed
//     build releases what it made; the filter was never touched;
//   - add: a new exact-rule table sized for everything the filter will
//     hold takes copies of the former entries (copies share the originals'
//     sockets and tags; whichever record survives owns them), the new
//     general rules are linked in front of the former ones, and a new scan
//     index (fw_index.h) covers both. Success frees only the memory of the
//     originals. Two roads:
//       - staged (FWAddRuleset, the ioctl push): all of it is built while
//         configLock is held shared, beside the rules in force, which it
//         only reads: packets keep flowing, writers wait. The copies leave
//         out what walks change under the shared hold (counters, the GRE
//         socket); the exclusive hold takes those over from the originals
//         (a walk over the copies, no allocation), links the new general
//         entries in and swaps table and index. If another writer changed
//         the rules between the two holds (FWFilterContext::generation),
//         the staged rules are thrown away and the addition staged again,
//         then built under the hold if the rules changed once more. A
//         failed build releases what it made; the filter was never
//         touched;
//       - in place (FWApplyRuleset, for callers holding the lock): the
//         same under the exclusive hold; the context is snapshotted first
//         and put back on failure.
//
// Resource-pool tags. Every tag obtained from the host is handed back
// exactly once, so that undoing or re-applying rulesets never leaks one:
//   - a tag obtained for a record is owned by the first entry the record
//     creates; a newly created mirror whose first half merged takes it too,
//     and a second new entry (both halves new) obtains its own reference
//     for the same pool name;
//   - a record that created no entry (it merged into an installed entry,
//     which keeps its own tag) hands its tag back at once;
//   - undo releases every exact entry created by this application in full
//     (tag handed back) and only frees the memory of copies. The two are
//     told apart by probing the former table: tuples are unique per table
//     and a repeat merges into the copy, so an entry of the new table is a
//     copy exactly when the former table holds its tuple. Replace has no
//     copies at all. Undo is rare, so the extra probe per entry is cheap.
//
// Every function here runs with the filter's configLock held exclusively,
// except FWPopulateRuleset (shared suffices), FWReplaceRuleset and
// FWAddRuleset (take it), the staging of a replacement (no lock: it touches
// no filter state) and the staging of an addition (shared).
//
// Every change of the rules in force raises ctx->generation, under the
// exclusive hold.

#include "firewall/fw_index.h"

namespace {

// The resource-pool name of a record, cut to the field and NUL-terminated:
// a hostile record need not hold a NUL within its 128 bytes.
struct FWPoolName {
  char text[sizeof(FWRule::resourcePool) + 1];
};

void FWCopyPoolName(const FWRule* rule, FWPoolName* name) {
  zel_Memcpy(name->text, rule->resourcePool, sizeof(rule->resourcePool));
  name->text[sizeof(rule->resourcePool)] = '\0';
}

// One reference to a pool tag, obtained for the record being installed.
struct FWPoolTagRef {
  uint16_t tag;
  bool held;     // not yet taken over by an entry
  FWPoolName name;
};

void FWObtainPoolTag(SLCGenericFilter* filter, const FWRule* rule, FWPoolTagRef* ref) {
  FWCopyPoolName(rule, &ref->name);
  ref->tag = zel_PortsetGetResPoolTag(ref->name.text);
  ref->held = true;
  if (ref->tag == ZEL_INVALID_RES_POOL_TAG) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Invalid resource pool %s specified",
                 ref->name.text);
  } else {
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Got resource pool tag of %d for pool %s",
                 ref->tag, ref->name.text);
  }
}

// Gives a newly created entry its tag: the record's reference when still
// held, else a fresh reference for the same pool.
void FWAssignPoolTag(FWRuleEntry* entry, FWPoolTagRef* ref) {
  if (entry->rule.action != SLCGenericActionResourcePoolTag) return;
  if (ref->held) {
    entry->poolTag = ref->tag;
    ref->held = false;
  } else {
    entry->poolTag = zel_PortsetGetResPoolTag(ref->name.text);
  }
}

void FWReleasePoolTag(FWPoolTagRef* ref) {
  if (ref->held) {
    zel_PortsetPutResPoolTag(ref->tag);
    ref->held = false;
  }
}

// The mirror of an exact bidirectional rule: the reply traffic's tuple,
// the opposite direction, and every other field (counters included) as is.
void FWBuildMirror(const FWRule* rule, FWRule* mirror) {
  zel_Memcpy(mirror, rule, sizeof(FWRule));
  zel_Memcpy(mirror->dMac, rule->sMac, sizeof(mirror->dMac));
  zel_Memcpy(mirror->sMac, rule->dMac, sizeof(mirror->sMac));
  const size_t addrLen = (rule->ruleFlags & FW_FLAG_IPV4) ? 4 : 16;
  zel_Memcpy(mirror->ipSa, rule->ipDa, addrLen);
  zel_Memcpy(mirror->ipDa, rule->ipSa, addrLen);
  zel_Memcpy(mirror->sPort, rule->dPort, sizeof(mirror->sPort));
  zel_Memcpy(mirror->dPort, rule->sPort, sizeof(mirror->dPort));
  mirror->bidirectional = 2;
  if (rule->direction == SLCGenericDirectionFromSwitch) {
    mirror->direction = SLCGenericDirectionToSwitch;
  } else if (rule->direction == SLCGenericDirectionToSwitch) {
    mirror->direction = SLCGenericDirectionFromSwitch;
  }
}

// Empties the new table on undo. `arg` is the former table when adding
// (entries whose tuple it holds are copies: memory only), null when
// replacing (every entry was created here and is released in full).
bool FWIterUndoEntry(void* elem, void* arg) {
  auto* entry = static_cast<FWRuleEntry*>(elem);
  const auto* former = static_cast<const Hash_Table*>(arg);
  List_Remove(&entry->link);
  FWRuleTuple tuple;
  FWFillTupleFromRule(&entry->rule, &tuple);
  if (former != nullptr && FWHashFindEntry(former, &tuple, entry->hash) != nullptr) {
    SLCGenericFree(entry);
  } else {
    FWRuleEntryFree(entry);
  }
  return true;
}

// Installs one work record (already widened to version 8). Returns false
// after logging when the application must be undone; `k` counts general
// entries created.
bool FWInstallRecord(SLCGenericFilter* filter, FWFilterContext* ctx, const FWRule* work,
                     uint32_t* k) {
  FWPoolTagRef tag{};
  if (work->action == SLCGenericActionResourcePoolTag) FWObtainPoolTag(filter, work, &tag);

  if (work->ruleFlags & FW_GENERAL_RULE_MASK) {
    auto* entry = static_cast<FWRuleEntry*>(SLCGenericAlloc(sizeof(FWRuleEntry)));
    if (entry == nullptr) {
      SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Failed to allocate rule list entry");
      FWReleasePoolTag(&tag);
      return false;
    }
    zel_Memcpy(&entry->rule, work, sizeof(FWRule));
    entry->direction = work->direction;
    FWAssignPoolTag(entry, &tag);
    // Front insertion; scans run from the back, so ruleset order holds.
    List_InsertAfter(&entry->link, &ctx->ruleList);
    ctx->numRules++;
    (*k)++;
    return true;
  }

  FWRuleEntry* entry = nullptr;
  uint32_t before = ctx->numRules;
  if (FWInsertRuleInHashTable(filter, ctx, work, &entry) != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Failed to insert hash entry");
    FWReleasePoolTag(&tag);
    return false;
  }
  if (ctx->numRules != before) FWAssignPoolTag(entry, &tag);

  if (work->bidirectional == 1) {
    FWRule mirror;
    FWBuildMirror(work, &mirror);
    before = ctx->numRules;
    if (FWInsertRuleInHashTable(filter, ctx, &mirror, &entry) != ZEL_OK) {
      SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name,
                   "Failed to insert second half of bidirectional rule");
      FWReleasePoolTag(&tag);
      return false;
    }
    if (ctx->numRules != before) FWAssignPoolTag(entry, &tag);
  }
  // Merged into installed entries: nothing refers to this reference.
  FWReleasePoolTag(&tag);
  return true;
}

// Installs records [0, numRecords) of `ruleset`, each widened to version 8
// first, into `ctx`; stops at the first record that must undo the
// application (false).
bool FWInstallRecords(SLCGenericFilter* filter, FWFilterContext* ctx, uint32_t version,
                      FWRuleset* ruleset, uint32_t numRecords, uint32_t* k) {
  for (uint32_t i = 0; i < numRecords; i++) {
    uint64_t size = 0;
    const uint8_t* record = FWGetRuleFromRuleset(version, ruleset, i, &size);
    FWRule work;
    zel_Memset(&work, 0, sizeof(work));
    zel_Memcpy(&work, record, size);
    FWUpdateWildcardsToCurrent(version, &work);
    if (!FWInstallRecord(filter, ctx, &work, k)) return false;
  }
  return true;
}

void FWReleaseList(ListLinks* head) {
  while (!List_IsEmpty(head)) {
    ListLinks* l = head->next;
    List_Remove(l);
    FWRuleEntryFree(FWEntryFromLink(l));
  }
}

}  // namespace

namespace {

// Version check and the opening log line, common to both modes.
ZelStatus FWCheckVersion(SLCGenericFilter* filter, const FWRuleset* ruleset, uint32_t replace) {
  const uint32_t version = ruleset->version;
  if (version != FW_RULESET_VERSION_7 && version != FW_RULESET_VERSION_8) {
    SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name, "Invalid ruleset version. Got %d, expecting %d",
                 static_cast<int>(version), static_cast<int>(FW_RULESET_VERSION_8));
    return ZEL_NOT_SUPPORTED;
  }
  SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name,
               "Applying %u fastpath firewall rules (with replace: %d) fwFeatures = 0x%x",
               ruleset->numRules, static_cast<int>(replace),
               static_cast<uint32_t>(ruleset->fwFeatures));
  return ZEL_OK;
}

// A replacing ruleset built in a context of its own, which no packet sees:
// it reads nothing of the filter's rules, so it needs no lock. Fills
// `staged` (its ruleList head must stay where it is) and returns ZEL_OK, or
// releases everything it made and returns ZEL_FAILURE (or
// ZEL_NOT_SUPPORTED for a version it does not know).
ZelStatus FWStageRuleset(SLCGenericFilter* filter, FWRuleset* ruleset, FWFilterContext* staged) {
  *staged = FWFilterContext{};
  List_Init(&staged->ruleList);
  if (ZelStatus s = FWCheckVersion(filter, ruleset, 1)) return s;
  const uint32_t version = ruleset->version;
  const uint32_t numRecords = ruleset->numRules;
  staged->ruleHash = FWAllocRuleHash(numRecords);
  if (staged->ruleHash == nullptr) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Failed to allocate firewall ruleset hash");
    return ZEL_FAILURE;
  }
  staged->fragOverride = ruleset->fragOverride;
  staged->version = version;
  staged->fwFeatures = ruleset->fwFeatures;

  uint32_t k = 0;
  bool ok = FWInstallRecords(filter, staged, version, ruleset, numRecords, &k);
  if (ok && FWScanIndexBuild(&staged->ruleList, &staged->scanIndex) != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Failed to allocate general rule index");
    ok = false;
  }
  if (ok) return ZEL_OK;

  SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Undoing ...");
  Hash_Iterate(staged->ruleHash, FWIterUndoEntry, nullptr);
  Hash_Free(staged->ruleHash);
  staged->ruleHash = nullptr;
  FWReleaseList(&staged->ruleList);
  return ZEL_FAILURE;
}

// Swaps the staged rules with those in force (configLock held
// exclusively): afterwards `staged` holds the former rules, for
// FWClearRules once no packet can see them. Allocates nothing.
void FWSwapStaged(FWFilterContext* ctx, FWFilterContext* staged) {
  ListLinks former;
  List_Init(&former);
  List_Append(&former, &ctx->ruleList);
  List_Append(&ctx->ruleList, &staged->ruleList);
  List_Append(&staged->ruleList, &former);
  Hash_Table* table = ctx->ruleHash;
  ctx->ruleHash = staged->ruleHash;
  staged->ruleHash = table;
  FWScanIndex* index = ctx->scanIndex;
  ctx->scanIndex = staged->scanIndex;
  staged->scanIndex = index;
  const uint32_t numRules = ctx->numRules;
  ctx->numRules = staged->numRules;
  staged->numRules = numRules;
  ctx->fragOverride = staged->fragOverride;
  ctx->version = staged->version;
  ctx->fwFeatures = staged->fwFeatures;
  ctx->generation++;
}

// Once a ruleset came by an ioctl road, the property and restores are
// ignored for the filter's life. configLock held exclusively.
bool FWIgnored(const FWFilterContext* ctx, uint32_t fromIoctl) {
  return ctx->ioctl != 0 && fromIoctl == 0;
}

// Adds `ruleset` (its version checked) to the rules in force, in place. A
// new table, sized for both, takes copies of the former entries; the new
// general rules are linked in front of the former ones. configLock held
// exclusively.
ZelStatus FWAddInPlace(SLCGenericFilter* filter, FWFilterContext* ctx, FWRuleset* ruleset) {
  ctx->generation++;
  const uint32_t version = ruleset->version;
  const uint32_t numRecords = ruleset->numRules;

  // Sized once for everything the filter will hold (32-bit sum, as the
  // sizing itself is 32-bit); no table ever grows while rules go in.
  Hash_Table* table = FWAllocRuleHash(numRecords + ctx->numRules);
  if (table == nullptr) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Failed to allocate firewall ruleset hash");
    return ZEL_FAILURE;
  }

  const FWFilterContext snapshot = *ctx;
  uint32_t k = 0;  // general entries created by this application
  bool ok = true;

  ctx->ruleHash = table;
  ctx->fragOverride = ruleset->fragOverride;
  ctx->version = version;
  ctx->fwFeatures = ruleset->fwFeatures;

  if (snapshot.ruleHash != nullptr) {
    FWRulesetCopyState copy{table, 0};
    (void)Hash_IterateWithCheck(snapshot.ruleHash, FWIterCopyElement, &copy);
    if (copy.failed) {
      SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Failed to copy hash entries");
      ok = false;
    }
  }

  ok = ok && FWInstallRecords(filter, ctx, version, ruleset, numRecords, &k);

  // The scan index of the general rules as they now stand (the former ones
  // first); the former index stays in force until success.
  FWScanIndex* index = nullptr;
  if (ok && FWScanIndexBuild(&ctx->ruleList, &index) != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Failed to allocate general rule index");
    ok = false;
  }

  if (ok) {
    FWScanIndex* former = snapshot.scanIndex;
    FWScanIndexFree(&former);
    ctx->scanIndex = index;
    if (snapshot.ruleHash != nullptr) {
      // The copies now own sockets and tags.
      Hash_Iterate(snapshot.ruleHash, FWIterFreeCopy, snapshot.ruleHash);
      Hash_Free(snapshot.ruleHash);
    }
    return ZEL_OK;
  }

  SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Undoing ...");
  Hash_Iterate(table, FWIterUndoEntry, snapshot.ruleHash);
  Hash_Free(table);
  // The k newest entries at the front of ruleList are this application's.
  for (; k > 0; k--) {
    ListLinks* l = ctx->ruleList.next;
    List_Remove(l);
    FWRuleEntryFree(FWEntryFromLink(l));
  }
  *ctx = snapshot;
  return ZEL_FAILURE;
}

// --- The staged addition ------------------------------------------------

// An addition built beside the rules in force. `rules` is a context no
// packet sees: its table holds copies of the former exact entries and the
// new exact entries, its list the new general entries (newest at the
// front, as ruleList), its index the former general entries followed by the
// new ones, its numRules the entries created. copies[i] was made of
// originals[i].
struct FWStagedAdd {
  FWFilterContext rules;
  FWRuleEntry** originals;  // one block: numCopies originals, then the copies
  FWRuleEntry** copies;
  uint32_t numCopies;
  uint32_t capacity;
  uint32_t generation;  // of the rules in force it was built from
};

// Everything the counters and the GRE socket are not: what walks never
// change, copied under the shared hold without reading what they write.
constexpr size_t kCountersAt = offsetof(FWRule, pktCount);
constexpr size_t kAfterCounters = offsetof(FWRule, byteCount) + sizeof(uint64_t);
static_assert(offsetof(FWRule, byteCount) == kCountersAt + sizeof(uint64_t));

bool FWIterStageCopy(void* elem, void* arg) {
  auto* staged = static_cast<FWStagedAdd*>(arg);
  const auto* from = static_cast<const FWRuleEntry*>(elem);
  // The former table holds at most numRules entries, the block's size.
  if (staged->numCopies == staged->capacity) return false;
  auto* copy = static_cast<FWRuleEntry*>(SLCGenericAlloc(sizeof(FWRuleEntry)));
  if (copy == nullptr) return false;
  copy->hash = from->hash;
  copy->direction = from->direction;
  auto* to = reinterpret_cast<uint8_t*>(&copy->rule);
  const auto* src = reinterpret_cast<const uint8_t*>(&from->rule);
  zel_Memcpy(to, src, kCountersAt);
  copy->rule.pktCount = 0;
  copy->rule.byteCount = 0;
  zel_Memcpy(to + kAfterCounters, src + kAfterCounters, sizeof(FWRule) - kAfterCounters);
  copy->greSocket = 0;
  copy->greSocketOpen = 0;
  copy->poolTag = from->poolTag;
  FWHashLinkEntry(staged->rules.ruleHash, copy);
  staged->originals[staged->numCopies] = const_cast<FWRuleEntry*>(from);
  staged->copies[staged->numCopies] = copy;
  staged->numCopies++;
  return true;
}

// Releases what a staging made: copies by their memory only (the originals
// own sockets and tags), created entries in full. Never touches the rules
// in force, which may have changed since.
void FWReleaseStaged(FWStagedAdd* staged) {
  for (uint32_t i = 0; i < staged->numCopies; i++) {
    List_Remove(&staged->copies[i]->link);
    SLCGenericFree(staged->copies[i]);
  }
  staged->numCopies = 0;
  FWClearRules(&staged->rules);
  if (staged->originals != nullptr) {
    SLCGenericFree(staged->originals);
    staged->originals = nullptr;
  }
}

// Builds the addition of `ruleset` (its version checked) beside the rules
// in force; configLock held shared. ZEL_OK, or ZEL_FAILURE with everything
// it made released.
ZelStatus FWStageAdd(SLCGenericFilter* filter, FWFilterContext* ctx, FWRuleset* ruleset,
                     FWStagedAdd* staged) {
  *staged = FWStagedAdd{};
  List_Init(&staged->rules.ruleList);
  staged->generation = ctx->generation;
  const uint32_t version = ruleset->version;
  const uint32_t numRecords = ruleset->numRules;
  staged->rules.ruleHash = FWAllocRuleHash(numRecords + ctx->numRules);
  if (staged->rules.ruleHash == nullptr) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Failed to allocate firewall ruleset hash");
    return ZEL_FAILURE;
  }

  bool ok = true;
  if (ctx->ruleHash != nullptr && ctx->numRules != 0) {
    const uint64_t bytes = 2ull * ctx->numRules * sizeof(FWRuleEntry*);
    auto* block = bytes <= UINT32_MAX
                      ? static_cast<FWRuleEntry**>(SLCGenericAlloc(static_cast<uint32_t>(bytes)))
                      : nullptr;
    staged->originals = block;
    staged->copies = block == nullptr ? nullptr : block + ctx->numRules;
    staged->capacity = block == nullptr ? 0 : ctx->numRules;
    if (block == nullptr || !Hash_IterateWithCheck(ctx->ruleHash, FWIterStageCopy, staged)) {
      SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Failed to copy hash entries");
      ok = false;
    }
  }

  uint32_t k = 0;
  ok = ok && FWInstallRecords(filter, &staged->rules, version, ruleset, numRecords, &k);
  if (ok && FWScanIndexBuild(&ctx->ruleList, &staged->rules.scanIndex,
                             &staged->rules.ruleList) != ZEL_OK) {
    SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Failed to allocate general rule index");
    ok = false;
  }
  if (ok) return ZEL_OK;

  SLCG_LOG_OBJ(SLCG_ATTENTION, filter->name, "Undoing ...");
  FWReleaseStaged(staged);
  return ZEL_FAILURE;
}

// Puts a staged addition in force (configLock held exclusively, the rules
// unchanged since it was built). Allocates nothing. Afterwards `staged`
// holds the former table and index, whose entries the copies replaced:
// FWReleaseReplaced frees them once no packet can see them.
void FWCommitStaged(FWFilterContext* ctx, const FWRuleset* ruleset, FWStagedAdd* staged) {
  // What walks changed on the originals since they were copied. Both
  // records are cache-cold in a large table: fetched a few pairs ahead.
  constexpr uint32_t kAhead = 8;
  for (uint32_t i = 0; i < staged->numCopies; i++) {
    if (i + kAhead < staged->numCopies) {
      const FWRuleEntry* from = staged->originals[i + kAhead];
      const FWRuleEntry* to = staged->copies[i + kAhead];
      __builtin_prefetch(&from->rule.pktCount);
      __builtin_prefetch(&from->greSocket);
      __builtin_prefetch(&to->rule.pktCount, 1);
      __builtin_prefetch(&to->greSocket, 1);
    }
    const FWRuleEntry* from = staged->originals[i];
    FWRuleEntry* to = staged->copies[i];
    to->rule.pktCount = from->rule.pktCount;
    to->rule.byteCount = from->rule.byteCount;
    to->greSocket = from->greSocket;
    to->greSocketOpen = from->greSocketOpen;
  }
  staged->numCopies = 0;  // the copies are in force now

  // The new general entries in front of the former ones.
  FWFilterContext& rules = staged->rules;
  List_Append(&rules.ruleList, &ctx->ruleList);
  List_Append(&ctx->ruleList, &rules.ruleList);

  Hash_Table* table = ctx->ruleHash;
  ctx->ruleHash = rules.ruleHash;
  rules.ruleHash = table;
  FWScanIndex* index = ctx->scanIndex;
  ctx->scanIndex = rules.scanIndex;
  rules.scanIndex = index;
  ctx->numRules += rules.numRules;
  rules.numRules = 0;
  ctx->fragOverride = ruleset->fragOverride;
  ctx->version = ruleset->version;
  ctx->fwFeatures = ruleset->fwFeatures;
  ctx->generation++;
}

// Frees what an addition replaced: the former index, and the former table
// with the memory of its entries (their copies own sockets and tags).
void FWReleaseReplaced(FWStagedAdd* staged) {
  FWScanIndexFree(&staged->rules.scanIndex);
  if (staged->rules.ruleHash != nullptr) {
    Hash_Iterate(staged->rules.ruleHash, FWIterFreeCopy, staged->rules.ruleHash);
    Hash_Free(staged->rules.ruleHash);
    staged->rules.ruleHash = nullptr;
  }
  if (staged->originals != nullptr) {
    SLCGenericFree(staged->originals);
    staged->originals = nullptr;
  }
}

// Stagings tried before the addition is built under the exclusive hold.
constexpr int kStagingAttempts = 2;

}  // namespace

void (*g_fwAddBetweenHolds)(SLCGenericFilter* filter) = nullptr;

ZelStatus FWApplyRuleset(SLCGenericFilter* filter, FWRuleset* ruleset, uint32_t replace,
                         uint32_t fromIoctl) {
  FWFilterContext* ctx = FWContext(filter);
  if (FWIgnored(ctx, fromIoctl)) return ZEL_OK;
  ctx->ioctl = fromIoctl ? 1 : 0;
  if (replace == 0) {
    if (ZelStatus s = FWCheckVersion(filter, ruleset, 0)) return s;
    return FWAddInPlace(filter, ctx, ruleset);
  }
  FWFilterContext staged;
  const ZelStatus status = FWStageRuleset(filter, ruleset, &staged);
  if (status != ZEL_OK) return status;
  FWSwapStaged(ctx, &staged);
  FWClearRules(&staged);
  return ZEL_OK;
}

ZelStatus FWReplaceRuleset(SLCGenericFilter* filter, FWRuleset* ruleset, uint32_t fromIoctl) {
  FWFilterContext* ctx = FWContext(filter);
  {
    // Skip the build when the outcome is already known; checked again
    // under the exclusive hold, as an ioctl push may come in between.
    SLCGenericReadGuard peek(ctx->configLock);
    if (FWIgnored(ctx, fromIoctl)) return ZEL_OK;
  }
  FWFilterContext staged;
  ZelStatus status = FWStageRuleset(filter, ruleset, &staged);
  {
    SLCGenericWriteGuard hold(ctx->configLock);
    if (FWIgnored(ctx, fromIoctl)) {
      status = ZEL_OK;  // staged rules (if any) released below
    } else {
      ctx->ioctl = fromIoctl ? 1 : 0;
      if (status == ZEL_OK) FWSwapStaged(ctx, &staged);
    }
  }
  // The former rules (or the unused staged ones): no packet sees them.
  FWClearRules(&staged);
  return status;
}

ZelStatus FWAddRuleset(SLCGenericFilter* filter, FWRuleset* ruleset, uint32_t fromIoctl) {
  FWFilterContext* ctx = FWContext(filter);
  {
    // As for a replacement: skip the build when the outcome is known.
    SLCGenericReadGuard peek(ctx->configLock);
    if (FWIgnored(ctx, fromIoctl)) return ZEL_OK;
  }
  const ZelStatus checked = FWCheckVersion(filter, ruleset, 0);
  for (int attempt = 1;; attempt++) {
    FWStagedAdd staged{};
    ZelStatus status = checked;
    bool built = false;
    if (status == ZEL_OK) {
      SLCGenericReadGuard shared(ctx->configLock);
      status = FWStageAdd(filter, ctx, ruleset, &staged);
      built = status == ZEL_OK;
    }
    if (built && g_fwAddBetweenHolds != nullptr) g_fwAddBetweenHolds(filter);
    bool committed = false, again = false;
    {
      SLCGenericWriteGuard hold(ctx->configLock);
      if (FWIgnored(ctx, fromIoctl)) {
        status = ZEL_OK;  // staged rules (if any) released below
      } else {
        ctx->ioctl = fromIoctl ? 1 : 0;
        if (built && staged.generation == ctx->generation) {
          FWCommitStaged(ctx, ruleset, &staged);
          committed = true;
        } else if (built) {
          SLCG_LOG_OBJ(SLCG_PROGRESS, filter->name,
                       "Firewall rules changed while rules to add were built");
          if (attempt < kStagingAttempts) {
            again = true;
          } else {
            status = FWAddInPlace(filter, ctx, ruleset);
          }
        }
      }
    }
    // After the hold: no packet sees these any more (or ever did).
    if (committed) {
      FWReleaseReplaced(&staged);
    } else if (built) {
      FWReleaseStaged(&staged);
    }
    if (!again) return status;
  }
}

void FWPopulateRuleset(FWFilterContext* ctx, FWRuleset* ruleset) {
  ruleset->version = static_cast<uint8_t>(ctx->version);
  ruleset->highestSupportedVersion = FW_RULESET_VERSION_8;
  ruleset->lowestSupportedVersion = FW_RULESET_VERSION_7;
  ruleset->numRules = 0;
  ruleset->fwFeatures = ctx->fwFeatures;
  ruleset->fragOverride = ctx->fragOverride;
  // Exact rules in table order, then general rules in ruleset order.
  if (ctx->ruleHash != nullptr) Hash_Iterate(ctx->ruleHash, FWIterRulesetGet, ruleset);
  for (ListLinks* l = ctx->ruleList.prev; l != &ctx->ruleList; l = l->prev) {
    (void)FWIterRulesetGet(FWEntryFromLink(l), ruleset);
  }
}

void FWTakeRules(FWFilterContext* ctx, FWFilterContext* former) {
  // A swap with no rules that keeps what a clear keeps (fragment override,
  // version) and drops the feature bits.
  List_Init(&former->ruleList);
  former->ruleHash = nullptr;
  former->scanIndex = nullptr;
  former->numRules = 0;
  former->generation = 0;
  former->fragOverride = ctx->fragOverride;
  former->version = ctx->version;
  former->fwFeatures = 0;
  FWSwapStaged(ctx, former);
}

void FWClearRules(FWFilterContext* ctx) {
  ctx->generation++;
  ctx->numRules = 0;
  ctx->fwFeatures = 0;
  FWScanIndexFree(&ctx->scanIndex);
  FWDestroyHash(&ctx->ruleHash);
  FWReleaseList(&ctx->ruleList);
}
