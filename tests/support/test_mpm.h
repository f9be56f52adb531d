// Small pieces the test programs share: numbered texts, the count of open
// descriptors, and what the test translators hand over (heap copies the
// library never frees) with the cleanup that frees them.
#ifndef OXIDM_TEST_MPM_H
#define OXIDM_TEST_MPM_H

#include <dirent.h>

#include <cstdlib>
#include <cstring>
#include <string>

#include "oxidm.h"

namespace oxtest {

// A prefix and a number as one text (appended: GCC 12 -O3 misreads
// literal + string).
inline std::string num(const char *prefix, long n) {
    std::string s(prefix);
    s += std::to_string(n);
    return s;
}

// Descriptors open in this process now.
inline int open_descriptors() {
    int n = 0;
    DIR *d = opendir("/proc/self/fd");
    while (dirent *e = readdir(d))
        if (e->d_name[0] != '.') ++n;
    closedir(d);
    return n - 1;  // not the one listing the directory
}

inline char *heap_copy(const char *s, size_t n) {
    auto *p = static_cast<char *>(std::malloc(n + 1));
    std::memcpy(p, s, n);
    p[n] = '\0';
    return p;
}
inline char *heap_copy(const char *s) { return heap_copy(s, std::strlen(s)); }

inline char **one_token(const char *s) {
    auto **t = static_cast<char **>(std::malloc(sizeof(char *)));
    t[0] = heap_copy(s);
    return t;
}

// A mapping buffer holding `local` with its NUL, as translators fill it.
inline idm_buffer *mapping_of(const char *local) {
    auto *b = static_cast<idm_buffer *>(std::malloc(sizeof(idm_buffer)));
    b->value = heap_copy(local);
    b->length = static_cast<uint32_t>(std::strlen(local) + 1);
    return b;
}

// Frees what a test translator put in a rule or an id (one token at most)
// and clears the record.
inline void free_rule(idm_rule *rule) {
    if (rule == nullptr) return;
    std::free(rule->rgy_type);
    std::free(rule->rgy);
    if (rule->tokens != nullptr) std::free(rule->tokens[0]);
    std::free(rule->tokens);
    if (rule->mapping != nullptr) std::free(rule->mapping->value);
    std::free(rule->mapping);
    *rule = idm_rule{};
}
inline void free_id(idm_id *id) {
    if (id == nullptr) return;
    std::free(id->rgy_type);
    std::free(id->rgy);
    if (id->tokens != nullptr) std::free(id->tokens[0]);
    std::free(id->tokens);
    *id = idm_id{};
}
inline int32_t free_rule_and_id(idm_rule *rule, idm_id *id) {
    free_rule(rule);
    free_id(id);
    return 0;
}

}  // namespace oxtest

#endif
