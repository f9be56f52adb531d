// Randomized search tree (treap) of opaque object pointers, ordered by a
// caller-supplied comparison routine and balanced in expectation by
// heap-ordered random node priorities (smallest priority at the root).
//
// The tree has no lock of its own: callers guard it (the cluster map guards
// its two trees with idmutex).  find and array only read the tree; insert
// (which also advances rst_seed), delete, clean and init change it.
//
// Ownership: the tree owns its nodes.  An object belongs to the tree from a
// successful insertion until a deletion hands it back or a clean passes it
// to rst_cleanup.  The tree looks at objects only through rst_compare.
//
// Every operation checks its arguments first; a rejected call returns -1 and
// changes nothing.
#ifndef OXSEC_RSTREE_H
#define OXSEC_RSTREE_H

#include <cstdint>

inline constexpr uint32_t kRstMagic = 0x72737472;  // 'r' 't' 's' 'r' in memory order

// (probe object, stored object): negative when the probe sorts before the
// stored object, positive after, 0 when they are equal.
typedef int (*rst_compare_routine)(const void *probe, const void *stored);
// Releases one stored object; called only by sec__rst_clean.
typedef void (*rst_cleanup_routine)(void *object);

struct rst_node {
    int32_t priority;  // no greater than either child's
    void *object;      // never null
    rst_node *left;    // objects that sort before `object`
    rst_node *right;   // objects that sort after `object`
};

struct rst_tree {
    uint32_t rst_magic;  // kRstMagic once initialised
    rst_node *rst_root;  // null when empty
    uint32_t rst_node_cnt;
    uint32_t rst_seed;  // rand_r state for priorities; never the process's global one
    rst_compare_routine rst_compare;
    rst_cleanup_routine rst_cleanup;
};

extern "C" {

// 0: initialised and empty, seed from the current time.  -1: tree null,
// already initialised (a tree is initialised once for its record's life),
// or a routine null.
int sec__rst_init(rst_tree *tree, rst_compare_routine compare, rst_cleanup_routine cleanup);
// 1: *object inserted.  0: an equal object is stored; *object now points to
// it and nothing is stored.  -2: no memory, tree unchanged.  -1: rejected
// (tree null or uninitialised, object or *object null).
int sec__rst_insert(rst_tree *tree, void **object);
// 1: found; *probe now points to the stored object.  0: not found.  -1 as
// for insert.  The tree is not changed.
int sec__rst_find(rst_tree *tree, void **probe);
// 1: removed; *probe now points to the removed object, which goes back to
// the caller without rst_cleanup.  0: not found.  -1 as for insert.
int sec__rst_delete(rst_tree *tree, void **probe);
// 0: *array (caller frees with free) holds every object in ascending order
// and *obj_cnt their number; an empty tree gives a null array and 0.
// -2: no memory (*array null).  -1: an argument null or tree uninitialised.
// A node count that disagrees with the nodes found stops the process as a
// failed assertion.
int sec__rst_array(rst_tree *tree, void ***array, uint32_t *obj_cnt);
// 0: every object passed to rst_cleanup (children before parents) and every
// node freed; the tree stays initialised and can be filled again.  -1:
// tree null or uninitialised.
int sec__rst_clean(rst_tree *tree);

}  // extern "C"

// ---- the search, for callers that know the tree's comparison ----

// Asks for the cache lines that hold the `bytes` bytes at `p` (at most two
// lines; a prefetch never faults, even for null).
inline void rst_prefetch(const void *p, uintptr_t bytes) {
    __builtin_prefetch(p);
    __builtin_prefetch(reinterpret_cast<const void *>(reinterpret_cast<uintptr_t>(p) + bytes - 1));
}

// Asks for the cache lines a search reaching `n` will read next: the start
// of its object (a cluster record's fields and the first bytes of its key)
// and its children.  Heap blocks are 16-byte aligned, so a node or a record
// may straddle two lines.
inline void rst_fetch_ahead(const rst_node *n) {
    rst_prefetch(n->object, 48);
    rst_prefetch(n->left, sizeof(rst_node));
    rst_prefetch(n->right, sizeof(rst_node));
}

// The search of sec__rst_find on a usable tree and a non-null probe, with
// `compare` (the tree's rst_compare, or a routine that orders exactly as it
// does) called directly so that it can be inlined.  The stored object equal
// to `probe`, or null.
template <class Compare>
inline void *rst_search(const rst_tree *tree, const void *probe, Compare compare) {
    const rst_node *n = tree->rst_root;
    if (n != nullptr) rst_fetch_ahead(n);
    while (n != nullptr) {
        // The next level's objects and the level after's nodes are fetched
        // while this level compares: a search of a tree larger than the
        // caches waits for about one miss per level instead of two.
        if (n->left != nullptr) rst_fetch_ahead(n->left);
        if (n->right != nullptr) rst_fetch_ahead(n->right);
        const int r = compare(probe, n->object);
        if (r == 0) return n->object;
        n = r < 0 ? n->left : n->right;
    }
    return nullptr;
}

#endif
