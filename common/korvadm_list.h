// SPDX-License-Identifier: Apache-2.0
/* The intrusive doubly-linked list used for every in-memory collection.
 *
 * A record embeds a list_node_t whose `owner` points back at the record; the
 * list_t header bounds and counts the chain. The list never allocates, owns
 * or frees records: each record kind has its *_new and *_free, and a list of
 * records is released by freeing the head's owner until the list is empty.
 *
 * Iteration: start at head, take each node's owner, step with next. */
#ifndef KORVADM_LIST_H
#define KORVADM_LIST_H

#ifdef __cplusplus
extern "C" {
#endif

typedef struct list_s list_t;
typedef struct list_node_s list_node_t;

struct list_node_s {
    void *owner;       /* record containing this node; set once at creation */
    list_t *list;      /* list the node is linked into, NULL when unlinked */
    list_node_t *next; /* NULL at the tail */
    list_node_t *prev; /* NULL at the head */
};

struct list_s {
    list_node_t *head; /* NULL exactly when empty */
    list_node_t *tail;
    int count;
};

void list_init(list_t *list);
void list_node_init(list_node_t *node, void *owner);
/* REQUIRES: node is unlinked (freshly initialised or removed). */
void list_append(list_node_t *node, list_t *list);
/* No-op for NULL, an unlinked node, or a node whose list is empty. */
void list_remove(list_node_t *node);
int list_is_empty(const list_t *list);
list_node_t *list_next(const list_node_t *node);
/* Frees the head's owner with free_fn until the list is empty; free_fn must
 * unlink the record. The header stays usable. NULL list: nothing happens. */
void list_release(list_t *list, void (*free_fn)(void *record));

#ifdef __cplusplus
}

#include <cstdlib>

namespace korv {

/* A record kind's *_new and *_free: a zeroed record whose list node (the
 * member node_of) is owned by itself, nullptr when memory is short; freeing
 * unlinks it first, and a NULL record is nothing to free.
 *
 *   iscsi_ip_t *ip = korv::list_record_new(&iscsi_ip_t::node); */
template <class T>
T *list_record_new(list_node_t T::*node_of)
{
    auto *rec = static_cast<T *>(std::calloc(1, sizeof(T)));
    if (rec)
        list_node_init(&(rec->*node_of), rec);
    return rec;
}

template <class T>
void list_record_free(T *rec, list_node_t T::*node_of)
{
    if (!rec)
        return;
    list_remove(&(rec->*node_of));
    std::free(rec);
}

/* Range over the records of a list: for (T *rec : list_records<T>(&list)).
 * Steps before yielding, so the current record may be freed in the body. */
template <class T>
class list_records {
public:
    explicit list_records(const list_t *list) : head_(list ? list->head : nullptr) {}
    struct iterator {
        list_node_t *node;
        list_node_t *after;
        explicit iterator(list_node_t *n) : node(n), after(n ? n->next : nullptr) {}
        T *operator*() const { return static_cast<T *>(node->owner); }
        iterator &operator++() { *this = iterator(after); return *this; }
        bool operator!=(const iterator &o) const { return node != o.node; }
    };
    iterator begin() const { return iterator(head_); }
    iterator end() const { return iterator(nullptr); }

private:
    list_node_t *head_;
};

/* First record for which pred(record) holds, or nullptr. */
template <class T, class Pred>
T *list_find(const list_t *list, Pred pred)
{
    for (T *rec : list_records<T>(list))
        if (pred(rec))
            return rec;
    return nullptr;
}

/* The common "add record" rule of every record kind's list family:
 * -1 when this very record is already listed (by key), -2 when another record
 * with an equal key is, else appends it and returns 0. Arguments are checked
 * by the caller, which logs in its own unit. */
template <class T, class Eq>
int list_add_unique(list_t *list, T *rec, list_node_t *node_of_rec, Eq equal_keys)
{
    T *found = list_find<T>(list, [&](T *other) { return equal_keys(other, rec); });
    if (found)
        return found == rec ? -1 : -2;
    list_append(node_of_rec, list);
    return 0;
}

/* Owns a C list of records for a C++ scope: the records still listed when it
 * goes out of scope are released with the kind's list free function
 * (target_conf_free_list, iscsi_ip_free_list, ...).
 *
 *   korv::list_owner ips(iscsi_ip_free_list);
 *   iscsi_mod_get_target_ip_list_in_target_parm(ips.get(), iqn, tpgt); */
class list_owner {
public:
    explicit list_owner(void (*free_list)(list_t *)) : free_list_(free_list) { list_init(&list_); }
    ~list_owner() { free_list_(&list_); }
    list_owner(const list_owner &) = delete;
    list_owner &operator=(const list_owner &) = delete;

    list_t *get() { return &list_; }
    const list_t *get() const { return &list_; }

    /* Moves every record, in order, to the tail of out; this list is left
     * empty, so nothing is released here any more. */
    void hand_over(list_t *out)
    {
        while (list_node_t *node = list_.head) {
            list_remove(node);
            list_append(node, out);
        }
    }

private:
    list_t list_;
    void (*free_list_)(list_t *);
};

/* The "all or nothing" reader: fill(private_list) reads records into a list
 * of its own; when it returns 0 they are handed over to the tail of out,
 * otherwise they are released with free_list and out stays as it was, so a
 * caller never sees half a set. Returns what fill returned. */
template <class Fill>
int fill_and_hand_over(list_t *out, void (*free_list)(list_t *), Fill fill)
{
    list_owner got(free_list);
    int rc = fill(got.get());
    if (rc == 0)
        got.hand_over(out);
    return rc;
}

}  // namespace korv
#endif

#endif
