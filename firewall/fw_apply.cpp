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
//   - add: under the hold, a new exact-rule table sized for everything the
//     filter will hold takes copies of the former entries (copies share
//     the originals' sockets and tags; whichever record survives owns them)
//     and the new general rules are linked in front of the former ones;
//     the context is snapshotted first and put back on failure. Success
//     installs a new scan index (fw_index.h), allocated last, and frees
//     only the memory of the originals.
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
// except FWPopulateRuleset (shared suffices), FWReplaceRuleset (takes it)
// and the staging of a replacement (no lock: it touches no filter state).

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
}

// Once a ruleset came by an ioctl road, the property and restores are
// ignored for the filter's life. configLock held exclusively.
bool FWIgnored(const FWFilterContext* ctx, uint32_t fromIoctl) {
  return ctx->ioctl != 0 && fromIoctl == 0;
}

// Adds `ruleset` to the rules in force. A new table, sized for both, takes
// copies of the former entries; the new general rules are linked in front
// of the former ones. configLock held exclusively.
ZelStatus FWAddRuleset(SLCGenericFilter* filter, FWFilterContext* ctx, FWRuleset* ruleset) {
  if (ZelStatus s = FWCheckVersion(filter, ruleset, 0)) return s;
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

}  // namespace

ZelStatus FWApplyRuleset(SLCGenericFilter* filter, FWRuleset* ruleset, uint32_t replace,
                         uint32_t fromIoctl) {
  FWFilterContext* ctx = FWContext(filter);
  if (FWIgnored(ctx, fromIoctl)) return ZEL_OK;
  ctx->ioctl = fromIoctl ? 1 : 0;
  if (replace == 0) return FWAddRuleset(filter, ctx, ruleset);
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

void FWClearRules(FWFilterContext* ctx) {
  ctx->numRules = 0;
  ctx->fwFeatures = 0;
  FWScanIndexFree(&ctx->scanIndex);
  FWDestroyHash(&ctx->ruleHash);
  FWReleaseList(&ctx->ruleList);
}
