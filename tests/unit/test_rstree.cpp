// Randomized search tree: long random sequences of insert, find and delete
// against std::set, with the search and heap order and the node count
// checked after every step and the stored object handed back wherever the
// caller gets one; clean; balance under sorted insertion, the
// process's random sequence untouched; calls on an unusable tree.
#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <random>
#include <set>
#include <vector>

#include "harness.h"
#include "oxidm_state.h"
#include "oxsec_rstree.h"

namespace {

int g_pool[512];  // the stored objects: g_pool[v] holds v
std::vector<int> g_cleaned;

int compare_ints(const void *probe, const void *stored) {
    const int a = *static_cast<const int *>(probe), b = *static_cast<const int *>(stored);
    return a < b ? -1 : a > b ? 1 : 0;
}
void cleanup_int(void *object) { g_cleaned.push_back(*static_cast<int *>(object)); }

// Nodes below n, or -1 when the search or heap order is broken.
long check(const rst_node *n, const int *lo, const int *hi) {
    if (n == nullptr) return 0;
    const int v = *static_cast<const int *>(n->object);
    const long l = check(n->left, lo, &v), r = check(n->right, &v, hi);
    const bool ok = (!lo || v > *lo) && (!hi || v < *hi) && (!n->left || n->left->priority >= n->priority) &&
                    (!n->right || n->right->priority >= n->priority);
    return ok && l >= 0 && r >= 0 ? 1 + l + r : -1;
}
size_t height(const rst_node *n) { return n ? 1 + std::max(height(n->left), height(n->right)) : 0; }

class Tree : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        for (int v = 0; v < 512; ++v) g_pool[v] = v;
        std::memset(static_cast<void *>(&tree), 0xA5, sizeof tree);  // init sets every field
        ASSERT_EQ(sec__rst_init(&tree, compare_ints, cleanup_int), 0);
    }
    void TearDown() override { sec__rst_clean(&tree); }
    // `op` with a probe equal to v (or g_pool[v] itself); `object` is what the call hands back.
    int call(int (*op)(rst_tree *, void **), int v, void *&object, bool own = false) {
        static int probe;
        probe = v;
        object = own ? &g_pool[v] : &probe;
        return op(&tree, &object);
    }
    bool sound() { return check(tree.rst_root, nullptr, nullptr) == long{tree.rst_node_cnt}; }
    std::vector<int> in_order() {
        void **array = reinterpret_cast<void **>(&array);
        uint32_t n = 99;
        EXPECT_EQ(sec__rst_array(&tree, &array, &n), 0);
        std::vector<int> out;
        for (uint32_t i = 0; i < n; ++i) out.push_back(*static_cast<int *>(array[i]));
        std::free(array);
        return out;
    }
    rst_tree tree;
};

TEST_F(Tree, RandomOperationsAgreeWithStdSet) {
    std::mt19937 rng(20240611);
    std::set<int> model;
    for (int step = 0; step < 20000; ++step) {
        const int v = static_cast<int>(rng() % 500);
        const bool present = model.count(v) != 0;
        void *object = nullptr;
        switch (rng() % 3) {
        case 0:
            ASSERT_EQ(call(sec__rst_insert, v, object, !present), present ? 0 : 1);
            model.insert(v);
            break;
        case 1: ASSERT_EQ(call(sec__rst_find, v, object), present ? 1 : 0) << v; break;
        default: ASSERT_EQ(call(sec__rst_delete, v, object), present ? 1 : 0) << v; model.erase(v);
        }
        if (present) { ASSERT_EQ(object, &g_pool[v]) << "step " << step; }
        ASSERT_TRUE(sound()) << "step " << step;
        if (step % 997 == 0) { ASSERT_EQ(in_order(), std::vector<int>(model.begin(), model.end())); }
    }
    // Clean passes every object once and leaves an empty tree that is still
    // initialised and can be filled again.
    ASSERT_EQ(sec__rst_clean(&tree), 0);
    std::sort(g_cleaned.begin(), g_cleaned.end());
    EXPECT_EQ(g_cleaned, std::vector<int>(model.begin(), model.end()));
    void *object = nullptr;
    EXPECT_TRUE(tree.rst_root == nullptr && tree.rst_node_cnt == 0 && in_order().empty());
    EXPECT_EQ(sec__rst_init(&tree, compare_ints, cleanup_int), -1);
    EXPECT_EQ(call(sec__rst_insert, 5, object, true), 1);
    // Sorted insertion stays shallow (a plain search tree would be a list of
    // 506 levels) and leaves the process's random sequence alone.
    std::srand(99);
    const int first = std::rand();
    std::srand(99);
    for (int v = 6; v < 512; ++v) ASSERT_EQ(call(sec__rst_insert, v, object, true), 1);
    EXPECT_EQ(std::rand(), first);
    EXPECT_TRUE(sound() && height(tree.rst_root) < 40u);
}

TEST_F(Tree, AnUnusableTreeOrObjectIsRejected) {
    rst_tree fresh{};
    void *object = &g_pool[1], *null_object = nullptr, **array = nullptr;
    uint32_t n = 0;
    for (auto [t, o] : {std::pair{&fresh, &object}, {&tree, &null_object}, {&tree, static_cast<void **>(nullptr)}})
        EXPECT_TRUE(sec__rst_insert(t, o) == -1 && sec__rst_find(t, o) == -1 && sec__rst_delete(t, o) == -1);
    EXPECT_TRUE(sec__rst_array(&fresh, &array, &n) == -1 && sec__rst_clean(&fresh) == -1 && tree.rst_node_cnt == 0);
}

}  // namespace
