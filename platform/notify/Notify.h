#pragma once

// platform/notify: named notifications (library tn_notify).
//
// Stands in for the platform's notification service: any process posts a
// notification by name, and every process observing that name learns of it.
// The daemon posts, for example, when the plug-in registry changes; clients
// observe.
//
// Each name is a small file, $TENON_ROOT/run/tenon/notify/<name>, holding
// the number of posts so far as decimal text and a newline ("3\n"). A post
// takes an exclusive lock on the file (flock), adds one and rewrites the
// number in place; readers take a shared lock, so they never see half a
// number. The count makes "exactly one notification per post" checkable:
// postCount() before and after tells how many posts happened in between, and
// an observer delivers one handler call per increment it sees, never
// coalescing. Observers watch the directory with inotify and re-read the
// count on every change of their file.
//
// Directories are created with mode 0755 and files with 0644: a name first
// posted by one user can be posted again only by that user (and root), so
// the daemon's notifications cannot be forged by other users. Removing a
// file restarts its count at zero.
//
//   NotificationName.h  valid names, their files, errors of this folder
//   Post.h              post(), postCount()
//   Observer.h          Observer: a handler on a queue, once per post
//
// Depends on platform/value, platform/dispatch and platform/log.

#include "platform/notify/NotificationName.h"
#include "platform/notify/Observer.h"
#include "platform/notify/Post.h"
