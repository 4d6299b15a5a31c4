// The host's list library: the out-of-line part (the inline helpers live in
// platform/zel_list.h).
#include "host/core/faults.h"
#include "platform/zel_list.h"

void List_Append(ListLinks* dst, ListLinks* src) {
  if (dst == nullptr || src == nullptr) host::Fatal("List_Append: null list head");
  if (dst == src) host::Fatal("List_Append: a list appended to itself");
  if (List_IsEmpty(src)) return;
  ListLinks* first = src->next;
  ListLinks* last = src->prev;
  first->prev = dst->prev;
  dst->prev->next = first;
  last->next = dst;
  dst->prev = last;
  List_Init(src);
}
