// Randomized search tree (see oxsec_rstree.h).  Insertion, the array walk
// and the clean walk recurse once per level; random priorities keep the
// expected height logarithmic whatever the order of insertion.  Search (in
// the header, rst_search) and deletion walk iteratively.
//
// The node-count assertion of sec__rst_array holds in every build, so the
// declaration of the assertion routine is wanted even under NDEBUG.
#undef NDEBUG
#include <assert.h>

#include "oxsec_rstree.h"

#include <cstdlib>
#include <ctime>

#include "oxidm_holds.h"

namespace {

bool usable(const rst_tree *tree) { return tree != nullptr && tree->rst_magic == kRstMagic; }

// The left child takes n's place; n becomes its right child.
void rotate_right(rst_node **link) {
    rst_node *n = *link;
    rst_node *l = n->left;
    n->left = l->right;
    l->right = n;
    *link = l;
}

// The right child takes n's place; n becomes its left child.
void rotate_left(rst_node **link) {
    rst_node *n = *link;
    rst_node *r = n->right;
    n->right = r->left;
    r->left = n;
    *link = r;
}

int rst_insert_recurse(rst_tree *tree, rst_node **link, void **object) {
    rst_node *n = *link;
    if (n == nullptr) {
        auto *node = static_cast<rst_node *>(idm::xmalloc(sizeof(rst_node)));
        if (node == nullptr) return -2;
        node->priority = rand_r(&tree->rst_seed);
        node->object = *object;
        node->left = nullptr;
        node->right = nullptr;
        *link = node;
        tree->rst_node_cnt++;
        return 1;
    }
    if (n->left != nullptr) rst_fetch_ahead(n->left);  // as in rst_search
    if (n->right != nullptr) rst_fetch_ahead(n->right);
    int r = tree->rst_compare(*object, n->object);
    if (r == 0) {
        *object = n->object;
        return 0;
    }
    if (r < 0) {
        int result = rst_insert_recurse(tree, &n->left, object);
        if (result == 1 && n->priority > n->left->priority) rotate_right(link);
        return result;
    }
    int result = rst_insert_recurse(tree, &n->right, object);
    if (result == 1 && n->priority > n->right->priority) rotate_left(link);
    return result;
}

// Appends the objects of the subtree in order.  Writes only within the
// array's `capacity`, but counts every node, so a corrupt node count is
// caught by the caller's assertion rather than by an overflow.
void rst_array_recurse(const rst_node *n, void **array, uint32_t capacity, uint32_t *count) {
    while (n != nullptr) {
        rst_array_recurse(n->left, array, capacity, count);
        if (*count < capacity) array[*count] = n->object;
        ++*count;
        n = n->right;
    }
}

void rst_clean_recurse(rst_tree *tree, rst_node **link) {
    rst_node *n = *link;
    if (n == nullptr) return;
    __builtin_prefetch(n->left);
    __builtin_prefetch(n->right);
    __builtin_prefetch(n->object);
    rst_clean_recurse(tree, &n->left);
    rst_clean_recurse(tree, &n->right);
    tree->rst_cleanup(n->object);
    n->object = nullptr;
    std::free(n);
    *link = nullptr;
}

}  // namespace

extern "C" {

int sec__rst_init(rst_tree *tree, rst_compare_routine compare, rst_cleanup_routine cleanup) {
    if (tree == nullptr || tree->rst_magic == kRstMagic || compare == nullptr || cleanup == nullptr) return -1;
    tree->rst_magic = kRstMagic;
    tree->rst_root = nullptr;
    tree->rst_node_cnt = 0;
    tree->rst_seed = static_cast<uint32_t>(std::time(nullptr));
    tree->rst_compare = compare;
    tree->rst_cleanup = cleanup;
    return 0;
}

int sec__rst_insert(rst_tree *tree, void **object) {
    if (!usable(tree) || object == nullptr || *object == nullptr) return -1;
    return rst_insert_recurse(tree, &tree->rst_root, object);
}

int sec__rst_find(rst_tree *tree, void **probe) {
    if (!usable(tree) || probe == nullptr || *probe == nullptr) return -1;
    void *found = rst_search(tree, *probe, tree->rst_compare);
    if (found == nullptr) return 0;
    *probe = found;
    return 1;
}

int sec__rst_delete(rst_tree *tree, void **probe) {
    if (!usable(tree) || probe == nullptr || *probe == nullptr) return -1;
    rst_node **link = &tree->rst_root;
    for (;;) {
        rst_node *n = *link;
        if (n == nullptr) return 0;
        int r = tree->rst_compare(*probe, n->object);
        if (r < 0) {
            link = &n->left;
        } else if (r > 0) {
            link = &n->right;
        } else if (n->left == nullptr || n->right == nullptr) {
            *link = n->left != nullptr ? n->left : n->right;
            *probe = n->object;
            std::free(n);
            tree->rst_node_cnt--;
            return 1;
        } else if (n->left->priority >= n->right->priority) {
            // Sink n below its right child; n is now that child's left child.
            rotate_left(link);
            link = &(*link)->left;
        } else {
            rotate_right(link);
            link = &(*link)->right;
        }
    }
}

int sec__rst_array(rst_tree *tree, void ***array, uint32_t *obj_cnt) {
    if (!usable(tree) || array == nullptr || obj_cnt == nullptr) return -1;
    *array = nullptr;
    *obj_cnt = 0;
    if (tree->rst_node_cnt == 0) return 0;
    auto **objects = static_cast<void **>(idm::xmalloc(sizeof(void *) * tree->rst_node_cnt));
    if (objects == nullptr) return -2;
    rst_array_recurse(tree->rst_root, objects, tree->rst_node_cnt, obj_cnt);
    if (*obj_cnt != tree->rst_node_cnt)
        __assert_fail("*obj_cnt == tree->rst_node_cnt", __FILE__, __LINE__, "sec__rst_array");
    *array = objects;
    return 0;
}

int sec__rst_clean(rst_tree *tree) {
    if (!usable(tree)) return -1;
    rst_clean_recurse(tree, &tree->rst_root);
    tree->rst_node_cnt = 0;
    return 0;
}

}  // extern "C"
