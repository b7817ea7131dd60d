#pragma once

// platform/notify: named notifications (library tn_notify).
//
// Stands in for the platform's notification service: any process posts a
// notification by name, and every process observing that name learns of it.
// The daemon posts, for example, when the plug-in registry changes; clients
// observe.
//
// Each name is a small file, $TENON_ROOT/run/tenon/notify/<name>, holding
// the number of posts so far as 20 zero-padded decimal digits and a newline
// ("00000000000000000003\n"). A post adds one and rewrites the record with
// one pwrite; readers read without a lock until two reads agree. Posters
// serialise on ".<name>.lock", a 0600 file of their own; nobody locks the
// notification file itself, which every user may open (and flock needs only
// that), so no peer can stall a poster. The count makes "exactly one notification per post" checkable:
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
