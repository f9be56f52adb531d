// Randomized search tree: checked against std::set over long random
// sequences with the search and heap invariants verified after every step,
// plus the argument checks, the results and the clean-up order.
#include <cstdlib>
#include <random>
#include <set>
#include <vector>

#include "harness.h"
#include "oxidm_state.h"
#include "oxsec_rstree.h"

namespace {

// Objects are heap ints so that the tree stores real pointers.
int compare_ints(const void *probe, const void *stored) {
    int a = *static_cast<const int *>(probe), b = *static_cast<const int *>(stored);
    return a < b ? -1 : a > b ? 1 : 0;
}
std::vector<int> g_cleaned;
void cleanup_int(void *object) {
    g_cleaned.push_back(*static_cast<int *>(object));
    delete static_cast<int *>(object);
}

class Tree : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        g_cleaned.clear();
        ASSERT_EQ(sec__rst_init(&tree, compare_ints, cleanup_int), 0);
    }
    void TearDown() override {
        idm_test_fail_alloc(0);
        sec__rst_clean(&tree);
        oxtest::Test::TearDown();
    }
    int insert(int v) {
        int *p = new int(v);
        void *object = p;
        int r = sec__rst_insert(&tree, &object);
        if (r != 1) delete p;
        return r;
    }
    int find(int v) {
        int probe = v;
        void *object = &probe;
        return sec__rst_find(&tree, &object);
    }
    int erase(int v) {
        int probe = v;
        void *object = &probe;
        int r = sec__rst_delete(&tree, &object);
        if (r == 1) delete static_cast<int *>(object);
        return r;
    }
    std::vector<int> in_order() {
        void **array = nullptr;
        uint32_t n = 0;
        EXPECT_EQ(sec__rst_array(&tree, &array, &n), 0);
        std::vector<int> out;
        for (uint32_t i = 0; i < n; ++i) out.push_back(*static_cast<int *>(array[i]));
        std::free(array);
        return out;
    }
    rst_tree tree{};
};

// Search order strictly within (lo, hi), heap order, and the node count.
size_t check_subtree(const rst_node *n, const int *lo, const int *hi, ::testing::AssertionResult &ok) {
    if (n == nullptr) return 0;
    int v = *static_cast<const int *>(n->object);
    if ((lo && v <= *lo) || (hi && v >= *hi)) ok = ::testing::AssertionFailure() << "search order broken at " << v;
    for (const rst_node *c : {n->left, n->right})
        if (c && c->priority < n->priority) ok = ::testing::AssertionFailure() << "heap order broken at " << v;
    return 1 + check_subtree(n->left, lo, &v, ok) + check_subtree(n->right, &v, hi, ok);
}
::testing::AssertionResult invariants(const rst_tree &t) {
    auto ok = ::testing::AssertionSuccess();
    size_t n = check_subtree(t.rst_root, nullptr, nullptr, ok);
    if (n != t.rst_node_cnt) return ::testing::AssertionFailure() << "count " << t.rst_node_cnt << " nodes " << n;
    return ok;
}

size_t height(const rst_node *n) { return n ? 1 + std::max(height(n->left), height(n->right)) : 0; }

TEST_F(Tree, RandomOperationsAgreeWithStdSet) {
    std::mt19937 rng(20240611);
    std::set<int> model;
    for (int step = 0; step < 20000; ++step) {
        int v = static_cast<int>(rng() % 500);
        switch (rng() % 3) {
        case 0: ASSERT_EQ(insert(v), model.insert(v).second ? 1 : 0) << "insert " << v; break;
        case 1: ASSERT_EQ(find(v), model.count(v) ? 1 : 0) << "find " << v; break;
        default: ASSERT_EQ(erase(v), model.erase(v) ? 1 : 0) << "delete " << v; break;
        }
        ASSERT_TRUE(invariants(tree)) << "after step " << step;
    }
    EXPECT_EQ(in_order(), std::vector<int>(model.begin(), model.end()));
}

TEST_F(Tree, AscendingInsertionStaysShallowAndSorted) {
    constexpr int kCount = 4096;
    for (int v = 0; v < kCount; ++v) ASSERT_EQ(insert(v), 1);
    EXPECT_TRUE(invariants(tree));
    // A plain search tree would be a list of 4096 levels.
    EXPECT_LT(height(tree.rst_root), 64u);
    std::vector<int> expected(kCount);
    for (int v = 0; v < kCount; ++v) expected[v] = v;
    EXPECT_EQ(in_order(), expected);
}

TEST_F(Tree, EqualInsertionHandsBackTheStoredObject) {
    int *stored = new int(7);
    void *object = stored;
    ASSERT_EQ(sec__rst_insert(&tree, &object), 1);
    int twin = 7;
    object = &twin;
    EXPECT_EQ(sec__rst_insert(&tree, &object), 0);
    EXPECT_EQ(object, stored);
    EXPECT_EQ(tree.rst_node_cnt, 1u);
    int probe = 7;
    object = &probe;
    EXPECT_EQ(sec__rst_find(&tree, &object), 1);
    EXPECT_EQ(object, stored);
}

TEST_F(Tree, EmptyTreeAndOneNodeTree) {
    EXPECT_EQ(find(1), 0);
    EXPECT_EQ(erase(1), 0);
    void **array = reinterpret_cast<void **>(&array);
    uint32_t n = 99;
    EXPECT_EQ(sec__rst_array(&tree, &array, &n), 0);
    EXPECT_EQ(array, nullptr);
    EXPECT_EQ(n, 0u);
    ASSERT_EQ(insert(1), 1);
    int probe = 1;
    void *object = &probe;
    ASSERT_EQ(sec__rst_delete(&tree, &object), 1);
    EXPECT_NE(object, &probe) << "the removed object comes back to the caller";
    delete static_cast<int *>(object);
    EXPECT_EQ(tree.rst_root, nullptr);
    EXPECT_EQ(tree.rst_node_cnt, 0u);
    EXPECT_TRUE(g_cleaned.empty()) << "deletion does not call the clean-up routine";
}

TEST_F(Tree, DeletingANodeWhoseChildrenHaveEqualPrioritiesRaisesTheRightChild) {
    for (int v : {2, 1, 3}) ASSERT_EQ(insert(v), 1);
    // Relink the three nodes by hand: 2 at the root, 1 and 3 below it with
    // equal priorities.
    rst_node *nodes[4] = {};
    auto collect = [&](auto &&self, rst_node *n) -> void {
        if (!n) return;
        nodes[*static_cast<int *>(n->object)] = n;
        self(self, n->left);
        self(self, n->right);
    };
    collect(collect, tree.rst_root);
    for (int v = 1; v <= 3; ++v) nodes[v]->left = nodes[v]->right = nullptr;
    tree.rst_root = nodes[2];
    nodes[2]->priority = 0;
    nodes[2]->left = nodes[1];
    nodes[2]->right = nodes[3];
    nodes[1]->priority = nodes[3]->priority = 5;
    ASSERT_TRUE(invariants(tree));
    ASSERT_EQ(erase(2), 1);
    EXPECT_EQ(tree.rst_root, nodes[3]);
    EXPECT_EQ(nodes[3]->left, nodes[1]);
    EXPECT_TRUE(invariants(tree));
}

TEST_F(Tree, CleanVisitsChildrenBeforeParentsAndLeavesTheTreeUsable) {
    std::mt19937 rng(7);
    std::set<int> model;
    for (int i = 0; i < 200; ++i) {
        int v = static_cast<int>(rng() % 1000);
        if (insert(v) == 1) model.insert(v);
    }
    // Expected post-order of the current shape.
    std::vector<int> expected;
    auto post = [&](auto &&self, const rst_node *n) -> void {
        if (!n) return;
        self(self, n->left);
        self(self, n->right);
        expected.push_back(*static_cast<const int *>(n->object));
    };
    post(post, tree.rst_root);
    const uint32_t seed = tree.rst_seed;
    ASSERT_EQ(sec__rst_clean(&tree), 0);
    EXPECT_EQ(g_cleaned, expected);
    EXPECT_EQ(g_cleaned.size(), model.size());
    EXPECT_EQ(tree.rst_root, nullptr);
    EXPECT_EQ(tree.rst_node_cnt, 0u);
    EXPECT_EQ(tree.rst_magic, kRstMagic);
    EXPECT_EQ(tree.rst_seed, seed);
    EXPECT_EQ(sec__rst_init(&tree, compare_ints, cleanup_int), -1);
    EXPECT_EQ(insert(5), 1);
}

TEST_F(Tree, PrioritiesComeFromTheTreesOwnSeed) {
    tree.rst_seed = 12345;
    ASSERT_EQ(insert(1), 1);
    unsigned expected_seed = 12345;
    const int expected = rand_r(&expected_seed);
    EXPECT_EQ(tree.rst_root->priority, expected);
    EXPECT_EQ(tree.rst_seed, expected_seed);
    // The process's global random sequence is untouched.
    std::srand(99);
    const int first = std::rand();
    std::srand(99);
    ASSERT_EQ(insert(2), 1);
    EXPECT_EQ(std::rand(), first);
}

TEST_F(Tree, InitStoresTheMagicAndTheTime) {
    rst_tree t{};
    const uint32_t before = static_cast<uint32_t>(std::time(nullptr));
    ASSERT_EQ(sec__rst_init(&t, compare_ints, cleanup_int), 0);
    EXPECT_EQ(std::memcmp(&t.rst_magic, "rtsr", 4), 0);
    EXPECT_GE(t.rst_seed, before);
    EXPECT_LE(t.rst_seed, static_cast<uint32_t>(std::time(nullptr)));
}

TEST_F(Tree, NoMemoryChangesNothing) {
    for (int v : {10, 20, 30}) ASSERT_EQ(insert(v), 1);
    const rst_node *root = tree.rst_root;
    const uint32_t seed = tree.rst_seed;
    idm_test_fail_alloc(1);
    EXPECT_EQ(insert(15), -2);
    EXPECT_EQ(tree.rst_node_cnt, 3u);
    EXPECT_EQ(tree.rst_root, root);
    EXPECT_EQ(tree.rst_seed, seed);
    EXPECT_TRUE(invariants(tree));
    idm_test_fail_alloc(1);
    void **array = reinterpret_cast<void **>(&array);
    uint32_t n = 0;
    EXPECT_EQ(sec__rst_array(&tree, &array, &n), -2);
    EXPECT_EQ(array, nullptr);
    EXPECT_TRUE(oxtest::nothing_reported()) << "the tree reports nothing itself";
}

TEST_F(Tree, BadArgumentsAreRejectedAndChangeNothing) {
    int value = 1;
    void *object = &value;
    void *null_object = nullptr;
    void **array = nullptr;
    uint32_t n = 0;
    rst_tree wrong{};
    wrong.rst_magic = 0x72737473;
    struct Case {
        const char *label;
        rst_tree *t;
        void **obj;
    } cases[] = {
        {"null tree", nullptr, &object},
        {"uninitialised tree", &wrong, &object},
        {"null address", &tree, nullptr},
        {"null object", &tree, &null_object},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        EXPECT_EQ(sec__rst_insert(c.t, c.obj), -1);
        EXPECT_EQ(sec__rst_find(c.t, c.obj), -1);
        EXPECT_EQ(sec__rst_delete(c.t, c.obj), -1);
    }
    EXPECT_EQ(tree.rst_node_cnt, 0u);
    EXPECT_EQ(sec__rst_array(nullptr, &array, &n), -1);
    EXPECT_EQ(sec__rst_array(&wrong, &array, &n), -1);
    EXPECT_EQ(sec__rst_array(&tree, nullptr, &n), -1);
    EXPECT_EQ(sec__rst_array(&tree, &array, nullptr), -1);
    EXPECT_EQ(sec__rst_clean(nullptr), -1);
    EXPECT_EQ(sec__rst_clean(&wrong), -1);
    rst_tree fresh{};
    EXPECT_EQ(sec__rst_init(nullptr, compare_ints, cleanup_int), -1);
    EXPECT_EQ(sec__rst_init(&fresh, nullptr, cleanup_int), -1);
    EXPECT_EQ(sec__rst_init(&fresh, compare_ints, nullptr), -1);
    EXPECT_EQ(fresh.rst_magic, 0u);
}

TEST_F(Tree, CorruptCountStopsTheProcessWithTheAssertionText) {
    for (int v : {1, 2, 3}) ASSERT_EQ(insert(v), 1);
    EXPECT_DEATH(
        {
            tree.rst_node_cnt = 2;
            void **array = nullptr;
            uint32_t n = 0;
            sec__rst_array(&tree, &array, &n);
        },
        "sec__rst_array.*\\*obj_cnt == tree->rst_node_cnt");
}

}  // namespace
