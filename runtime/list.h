// Intrusive doubly linked lists. A record has two members: `next`, the following record, and `prev_link`, the
// pointer that points to this record (the head, or the `next` of the record before). A record therefore
// unlinks itself without the head, and the list owns nothing.
//
// The caller holds whatever lock guards the list. Nothing here allocates or fails.
#pragma once

// New first record.
template <typename T>
void list_push_head(T **head, T *record) {
    record->next = *head;
    record->prev_link = head;
    if (*head)
        (*head)->prev_link = &record->next;
    *head = record;
}
// New record directly after `place`.
template <typename T>
void list_insert_after(T *place, T *record) {
    list_push_head(&place->next, record);
}
// Takes the record out of its list and clears both its pointers.
template <typename T>
void list_unlink(T *record) {
    *record->prev_link = record->next;
    if (record->next)
        record->next->prev_link = record->prev_link;
    record->next = nullptr;
    record->prev_link = nullptr;
}
