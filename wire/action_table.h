// Looking an action code up in a dispatch table: an array of entries whose
// member `action` holds the code (the daemon, the players and the queue
// each keep one).
#ifndef TARN_ACTION_TABLE_H
#define TARN_ACTION_TABLE_H

#include <cstddef>

// The entry of table for action, or nullptr when the table has none.
template <typename Entry, size_t N>
const Entry *FindAction(const Entry (&table)[N], int action)
{
    for (const Entry &e : table) {
        if (e.action == action)
            return &e;
    }
    return nullptr;
}

#endif
