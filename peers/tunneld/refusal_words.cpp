#include "peers/tunneld/plane.h"

const char *const refusal_words[REFUSALS] = {"source", "flags", "checksum", "protocol",
                                             "length", "inner", "room"};
