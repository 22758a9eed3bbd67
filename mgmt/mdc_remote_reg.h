// The monitoring nodes that a daemon has registered, as a tree for the time of one query. For mdc_misc.cpp
// and its tests.
#pragma once

#include "runtime/tree.h"
#include "runtime/tstr_array.h"

struct mdc_remote_reg;

// A record of a registered node: its name, and its capability mask.
lc_status mdc_remote_reg_new_node(mdc_remote_reg **out, const char *name, uint32_t cap_mask);
void mdc_remote_reg_free(mdc_remote_reg **inout);
lc_status mdc_remote_reg_add_node(tree *registered, mdc_remote_reg **inout_record); // the tree takes it over
void mdc_remote_reg_free_for_tree(void *value);
// Both outs are null if there is no such node. An intermediate node has no record.
lc_status mdc_remote_reg_get_node_tree(const tree *registered, const tstr_array *parts, tree_node **out_node,
                                       const mdc_remote_reg **out_record);
const char *mdc_remote_reg_get_name(const mdc_remote_reg *record);
uint32_t mdc_remote_reg_get_cap_mask(const mdc_remote_reg *record);
