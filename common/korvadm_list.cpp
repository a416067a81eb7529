// SPDX-License-Identifier: Apache-2.0
// The intrusive list operations; every collection in the program uses these.
#include "common/korvadm_list.h"

#include <cstddef>

void list_init(list_t *list)
{
    list->head = nullptr;
    list->tail = nullptr;
    list->count = 0;
}

void list_node_init(list_node_t *node, void *owner)
{
    node->owner = owner;
    node->list = nullptr;
    node->next = nullptr;
    node->prev = nullptr;
}

void list_append(list_node_t *node, list_t *list)
{
    if (list->head) {
        node->prev = list->tail;
        list->tail->next = node;
        list->tail = node;
    } else {
        list->tail = node;
        list->head = node;
    }
    node->list = list;
    list->count++;
}

void list_remove(list_node_t *node)
{
    if (!node || !node->list || !node->list->head)
        return;
    list_t *list = node->list;
    if (list->head == node)
        list->head = node->next;
    if (list->tail == node)
        list->tail = node->prev;
    if (node->prev)
        node->prev->next = node->next;
    if (node->next)
        node->next->prev = node->prev;
    list->count--;
    node->list = nullptr;
    node->next = nullptr;
    node->prev = nullptr;
}

int list_is_empty(const list_t *list)
{
    return list->head == nullptr;
}

list_node_t *list_next(const list_node_t *node)
{
    return node ? node->next : nullptr;
}

void list_release(list_t *list, void (*free_fn)(void *record))
{
    if (!list)
        return;
    while (!list_is_empty(list))
        free_fn(list->head->owner);
}
