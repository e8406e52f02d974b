/*
 * The platform's task scheduler: entries that run a command on a timetable
 * and show in the desktop's scheduler list.
 *
 * An entry is worked on through a scheduler task object: allocate one, fill
 * it (or load a saved entry into it), save it, free it. A new object has no
 * id; the first save gives it one. Ids are signed 64-bit numbers, never
 * below 1. Objects belong to their caller and are not shared between
 * threads; the saved entries may be loaded, saved and listed from several
 * threads and processes at once.
 *
 * Calls returning int give 0 on success and a negative number on failure,
 * with the platform's last error set (vlibc.h): VLIBC_ERR_BAD_PARAMETER for
 * a null object or an unusable value, VLIBC_ERR_NOT_FOUND for an unknown
 * id, VLIBC_ERR_IO when the saved entries cannot be read or written.
 *
 * The timetable is set from JSON by VELTSchedTaskConvertFromJson_Schedule;
 * docs/platform.md lists the keys the development implementation
 * understands and the form of the next trigger time.
 */
#ifndef VELT_SCHED_H
#define VELT_SCHED_H

#include <json/value.h>
#include <sys/types.h>

#include <cstdint>
#include <string>

#include "velt/vlibc.h"

#define VELT_SCHED_API __attribute__((visibility("default")))

/* A scheduler task object (opaque). */
typedef struct _tag_VELTSCHEDTASK VELTSCHEDTASK, *PVELTSCHEDTASK;
/* A list of saved entries read by VELTSchedTaskListGet (opaque). */
typedef struct _tag_VELTSCHEDTASKLIST VELTSCHEDTASKLIST, *PVELTSCHEDTASKLIST;

/* Keeps an entry in a list when it returns true. */
typedef bool (*VELTSchedTaskFilter)(const VELTSCHEDTASK* task);

/* A new, empty object: no id, enabled, listable, no timetable. NULL when
 * memory runs out. */
VELT_SCHED_API PVELTSCHEDTASK VELTSchedTaskAlloc(void);
/* Frees an object. NULL is allowed. */
VELT_SCHED_API void VELTSchedTaskFree(PVELTSCHEDTASK task);

/* Replaces the object's content with the saved entry id. */
VELT_SCHED_API int VELTSchedTaskLoad(int64_t id, PVELTSCHEDTASK task);
/* Saves the object: an object without an id becomes a new entry and gets
 * its id (VELTSchedCTaskGetID); one with an id replaces that entry, which
 * must exist. */
VELT_SCHED_API int VELTSchedTaskSave(PVELTSCHEDTASK task);
/* Deletes the saved entry id. */
VELT_SCHED_API int VELTSchedTaskRemove(int64_t id);

/* Reads every saved entry that filter keeps (all when filter is NULL), in
 * id order, into a new list stored in *list; free it with
 * VELTSchedTaskListFree. */
VELT_SCHED_API int VELTSchedTaskListGet(PVELTSCHEDTASKLIST* list, VELTSchedTaskFilter filter);
/* The list's next entry, NULL after the last. The entry belongs to the
 * list; it may be changed and saved while the list lives. */
VELT_SCHED_API PVELTSCHEDTASK VELTSchedTaskNext(PVELTSCHEDTASKLIST list);
/* Frees a list and its entries. NULL is allowed. */
VELT_SCHED_API void VELTSchedTaskListFree(PVELTSCHEDTASKLIST list);

/* The object's flags; false for NULL. */
VELT_SCHED_API bool VELTSchedTaskIsEnabled(const VELTSCHEDTASK* task);
VELT_SCHED_API bool VELTSchedTaskIsListable(const VELTSCHEDTASK* task);

/* Sets the object's timetable from json, whose "schedule" member is an
 * object of timetable keys. Fails (VLIBC_ERR_BAD_PARAMETER) when a key is
 * missing or out of range; the object is then unchanged. */
VELT_SCHED_API int VELTSchedTaskConvertFromJson_Schedule(const Json::Value& json,
                                                         PVELTSCHEDTASK task);
/* The next time the timetable fires after now, in local time, as
 * "YYYY/MM/DD HH:MM"; "" when the object has no timetable or it names no
 * day, and also when the platform cannot tell the time (the last error is
 * then set). */
VELT_SCHED_API std::string VELTSchedTaskGetNextTriggerTime(const VELTSCHEDTASK* task);

/* Setters of the object's fields. Strings are copied; flags are 0 or not 0. */
VELT_SCHED_API int VELTSchedCTaskSetApp(PVELTSCHEDTASK task, const char* app);
VELT_SCHED_API int VELTSchedCTaskSetAppName(PVELTSCHEDTASK task, const char* appName);
VELT_SCHED_API int VELTSchedCTaskSetName(PVELTSCHEDTASK task, const char* name);
VELT_SCHED_API int VELTSchedCTaskSetAction(PVELTSCHEDTASK task, const char* action);
VELT_SCHED_API int VELTSchedCTaskSetCommand(PVELTSCHEDTASK task, const char* command);
VELT_SCHED_API int VELTSchedCTaskSetState(PVELTSCHEDTASK task, int enabled);
VELT_SCHED_API int VELTSchedCTaskSetCanRunAppSameTime(PVELTSCHEDTASK task, int allowed);
VELT_SCHED_API int VELTSchedCTaskSetCanRunTaskSameTime(PVELTSCHEDTASK task, int allowed);
VELT_SCHED_API int VELTSchedCTaskSetCanRunFromUI(PVELTSCHEDTASK task, int allowed);
VELT_SCHED_API int VELTSchedCTaskSetOwner(PVELTSCHEDTASK task, uid_t owner);
VELT_SCHED_API int VELTSchedCTaskSetCanEditName(PVELTSCHEDTASK task, int allowed);
VELT_SCHED_API int VELTSchedCTaskSetCanEditOwner(PVELTSCHEDTASK task, int allowed);
VELT_SCHED_API int VELTSchedCTaskSetCanDeleteFromUI(PVELTSCHEDTASK task, int allowed);
VELT_SCHED_API int VELTSchedCTaskSetListable(PVELTSCHEDTASK task, int listable);

/* The object's application; fails (VLIBC_ERR_NOT_FOUND) when none is set. */
VELT_SCHED_API int VELTSchedCTaskGetApp(const VELTSCHEDTASK* task, std::string& app);
/* The object's id; fails (VLIBC_ERR_NOT_FOUND) before its first save. */
VELT_SCHED_API int VELTSchedCTaskGetID(const VELTSCHEDTASK* task, int64_t* id);

#endif
