#pragma once

#include <stdint.h>

#include "SqlTypes.h"

namespace kelvo {

struct column_attribute {
    int32_t type; // column_type
    const char* name;
};

// The static definition of one table. Definitions are never freed: the schema
// registry and the insert path keep pointers to them.
struct table_attribute {
    const char* version; // compared as a whole string
    int32_t has_id;      // 1: implicit first column "id" (COLUMN_ID)
    int32_t count;       // listed columns, id not counted
    const column_attribute* columns;
    const char* name;
};

} // namespace kelvo
