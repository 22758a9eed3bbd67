// Intrusive doubly linked lists. A record has two members: `next`, the following record or null, and
// `prev_link`, the address of the pointer that points to this record (the list's head, or the `next` of the
// record before it). That is why a record can be unlinked without knowing its list. A list does not own its
// records.
//
// The caller holds the lock that guards the list. Nothing here allocates or fails.
#pragma once

// Inserts a record at the front.
template <typename T>
void list_push_head(T **head, T *record) {
    record->next = *head;
    record->prev_link = head;
    if (*head)
        (*head)->prev_link = &record->next;
    *head = record;
}
// Inserts a record directly after `place`.
template <typename T>
void list_insert_after(T *place, T *record) {
    list_push_head(&place->next, record);
}
// Removes the record from its list and sets both its pointers to null.
template <typename T>
void list_unlink(T *record) {
    *record->prev_link = record->next;
    if (record->next)
        record->next->prev_link = record->prev_link;
    record->next = nullptr;
    record->prev_link = nullptr;
}
