// Intrusive circular doubly linked lists, as the host's list library lays
// them out. A list head is a ListLinks whose next and prev point at itself
// when the list is empty; an element embeds a ListLinks (at offset 0 when it
// lives in a host hash table).
//
// The inline helpers are the library's header part; List_Append is a host
// call.
#pragma once

struct ListLinks {
  ListLinks* next;
  ListLinks* prev;
};

inline void List_Init(ListLinks* head) {
  head->next = head;
  head->prev = head;
}

inline bool List_IsEmpty(const ListLinks* head) { return head->next == head; }

// Links `elem` directly after `pos` (at the front when `pos` is a head).
inline void List_InsertAfter(ListLinks* elem, ListLinks* pos) {
  elem->next = pos->next;
  elem->prev = pos;
  pos->next->prev = elem;
  pos->next = elem;
}

// Links `elem` directly before `pos` (at the end when `pos` is a head).
inline void List_InsertBefore(ListLinks* elem, ListLinks* pos) {
  elem->prev = pos->prev;
  elem->next = pos;
  pos->prev->next = elem;
  pos->prev = elem;
}

// Unlinks `elem` and clears its links.
inline void List_Remove(ListLinks* elem) {
  elem->prev->next = elem->next;
  elem->next->prev = elem->prev;
  elem->next = nullptr;
  elem->prev = nullptr;
}

inline bool List_IsLinked(const ListLinks* elem) { return elem->next != nullptr; }

// Moves every element of `src` to the end of `dst`, in order; `src` is left
// empty. Host library call.
void List_Append(ListLinks* dst, ListLinks* src);

// Container access: the record that embeds `links` as member `member`.
#define LIST_CONTAINER(links, type, member) \
  (reinterpret_cast<type*>(reinterpret_cast<char*>(links) - offsetof(type, member)))
