/// First-match lookup over a record list through its RecordIndex.
///
/// Lookups by index or name must answer exactly what a walk from the list
/// head would: the first record in list order that matches.  A reader that
/// loads ten thousand jobs asks for each new index before adding it, so a
/// walk per lookup would be quadratic.  The table keeps, per key, the first
/// record and the number of records sharing the key; only a unique key is
/// answered from the table.  Shared keys, a stale first pointer and a
/// candidate that no longer matches (renamed under us) all fall back to the
/// walk, so the table can make a lookup slower but never wrong for records
/// that were registered.
///
/// Used only by the record units (rj_job, rj_dev); the tables themselves are
/// reached through rndctl, never cached, since a reload swaps them together
/// with the list heads.
#pragma once

#include "Utility/rndctl/records/rj_records.h"

template <class T, class Key>
void recindex_add(RecordIndex<T, Key>& table, const Key& key, T* rec) {
  auto& slot = table.slots[key];
  // With a shared key the first record is found by walking; no need to know
  // which of them comes first in the list.
  slot.first = slot.count == 0 ? rec : nullptr;
  slot.count++;
}

/// Forgets `rec` under `key`.  Call after `rec` has left the list: when one
/// record is left with the key, the walk from `head` finds it again.
template <class T, class Key, class Match>
void recindex_remove(RecordIndex<T, Key>& table, const Key& key, T* rec, T* head, Match matches) {
  auto it = table.slots.find(key);
  if (it == table.slots.end()) return;
  auto& slot = it->second;
  if (--slot.count <= 0) {
    table.slots.erase(it);
    return;
  }
  slot.first = nullptr;
  if (slot.count == 1) {
    for (T* r = head; r != nullptr; r = r->next) {
      if (r != rec && matches(r)) {
        slot.first = r;
        break;
      }
    }
  }
}

/// The first record of the list from `head` matching `key`, or null.
/// `matches(rec)` is the real test; `walk_on_miss` makes a key missing from
/// the table fall back to the walk too (for keys that can change after the
/// record was registered).  Nothing found by a walk is cached: only records
/// registered under a key may be remembered under it, or a delete could
/// leave a dangling pointer behind.
template <class T, class Key, class Match>
T* recindex_find(RecordIndex<T, Key>& table, const Key& key, T* head, Match matches,
                 bool walk_on_miss) {
  auto it = table.slots.find(key);
  // An empty table over a non-empty list means records were linked by hand
  // (or the list was set aside without its table): only the walk knows.
  if (it == table.slots.end() && !walk_on_miss && !table.slots.empty()) return nullptr;
  if (it != table.slots.end() && it->second.count == 1 && it->second.first != nullptr &&
      matches(it->second.first))
    return it->second.first;
  for (T* rec = head; rec != nullptr; rec = rec->next)
    if (matches(rec)) return rec;
  return nullptr;
}
