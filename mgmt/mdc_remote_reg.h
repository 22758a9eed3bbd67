// The daemon's registered monitoring nodes, as a tree for the length of one query.
#pragma once

#include "runtime/tree.h"
#include "runtime/tstr_array.h"

struct mdc_remote_reg;

lc_status mdc_remote_reg_new_node(mdc_remote_reg **out, const char *name, uint32_t cap_mask);
void mdc_remote_reg_free(mdc_remote_reg **inout);
lc_status mdc_remote_reg_add_node(tree *registered, mdc_remote_reg **inout_record); // the tree owns it then
void mdc_remote_reg_free_for_tree(void *value);
// Both null when there is no such node; a mere path element has no record.
lc_status mdc_remote_reg_get_node_tree(const tree *registered, const tstr_array *parts, tree_node **out_node,
                                       const mdc_remote_reg **out_record);
const char *mdc_remote_reg_get_name(const mdc_remote_reg *record);
uint32_t mdc_remote_reg_get_cap_mask(const mdc_remote_reg *record);
