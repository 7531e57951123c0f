#pragma once

// The device's big-data event library. An event object collects parameters
// (integers, texts, child objects, arrays of child objects, dynamic paths)
// and is sent as one event. Texts and child objects are copied: the caller
// may free them right after the call.

#include <stdint.h>

struct zendrel_eventobj;
typedef struct zendrel_eventobj zendrel_eventobj;

// A new object for an event id or a class id; null on failure.
zendrel_eventobj* zendrel_create_eventobj(uint32_t id);
void zendrel_destroy_eventobj(zendrel_eventobj* obj);

// Sets one parameter; 0 on success.
int zendrel_set_param(zendrel_eventobj* obj, uint16_t param, int64_t value);
int zendrel_set_param(zendrel_eventobj* obj, uint16_t param, const char* text);
int zendrel_set_param(zendrel_eventobj* obj, uint16_t param, const zendrel_eventobj* child);

// Appends a copy of the child to an array parameter; 0 on success.
int zendrel_fill_array_param(zendrel_eventobj* obj, uint16_t param, const zendrel_eventobj* child);

// Names a file to go with the event; 0 on success.
int zendrel_add_and_del_dynamic_path(zendrel_eventobj* obj, const char* path);

// Sends the event; negative on failure.
int zendrel_send_event(zendrel_eventobj* obj);
