// Pieces of the task database's schema (version 2) that both the database
// itself and the migration from version 1 create, kept in one place so that
// a migrated database is the same as a new one.
#ifndef PLOVO_DB_TASK_DB_SCHEMA_H
#define PLOVO_DB_TASK_DB_SCHEMA_H

#define PLOVO_TASK_INFO_TABLE                    \
  "CREATE TABLE IF NOT EXISTS task_info_table (" \
  " id INTEGER PRIMARY KEY AUTOINCREMENT,"       \
  " usb_id INTEGER NOT NULL,"                    \
  " is_enable INTEGER NOT NULL,"                 \
  " task_name TEXT NOT NULL,"                    \
  " task_type INTEGER NOT NULL,"                 \
  " usb_folder_path TEXT NOT NULL,"              \
  " nas_folder_path TEXT NOT NULL,"              \
  " nas_share_name TEXT NOT NULL,"               \
  " last_copied_time INTEGER NOT NULL,"          \
  " copy_strategy INTEGER NOT NULL,"             \
  " keep_dir_structure INTEGER NOT NULL,"        \
  " smart_create_date_dir INTEGER NOT NULL,"     \
  " rename_photo_video INTEGER NOT NULL,"        \
  " remove_src_file INTEGER NOT NULL,"           \
  " conflict_policy INTEGER NOT NULL,"           \
  " enable_rotation INTEGER NOT NULL,"           \
  " max_version_count INTEGER NOT NULL,"         \
  " rotation_policy INTEGER NOT NULL,"           \
  " schedule_id INTEGER DEFAULT -1,"             \
  " error INTEGER NOT NULL);"

#define PLOVO_TASK_INFO_INDEXES                                                              \
  "CREATE INDEX IF NOT EXISTS task_info_table_usb_id_idx on task_info_table(usb_id);"       \
  "CREATE INDEX IF NOT EXISTS task_info_table_nas_share_name_idx on task_info_table(nas_share_name);"

// Removing a device removes its tasks.
#define PLOVO_USB_INFO_DELETE_TRIGGER                                                    \
  "CREATE TRIGGER IF NOT EXISTS usb_info_delete_trigger AFTER DELETE ON usb_info_table" \
  " BEGIN DELETE FROM task_info_table WHERE usb_id = OLD.id; END;"

// Removing a device's last task removes the device.
#define PLOVO_TASK_INFO_DELETE_TRIGGER                                                      \
  "CREATE TRIGGER IF NOT EXISTS task_info_delete_trigger AFTER DELETE ON task_info_table"   \
  " BEGIN DELETE FROM usb_info_table WHERE id = OLD.usb_id AND"                             \
  " (0 = (SELECT COUNT(*) FROM task_info_table WHERE usb_id = OLD.usb_id)); END;"

#endif
