#include "peers/tunneld/plane.h"

const data_plane *const data_planes[3] = {&kernel_plane, &user_plane, &table_plane};
