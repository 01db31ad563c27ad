/* map-file.h - the process-wide mapping of the account map, checked against the file at each use */
#ifndef KEST_MAP_FILE_H
#define KEST_MAP_FILE_H

#include "account-map.h"

typedef enum kest_map_result (*kest_map_use)(const struct kest_map_view *view, void *context);

/* Runs use on the published map, under the mapping's lock, and returns its result. KEST_MAP_BROKEN without
 * calling use when no map can be trusted: none published (withdrawn, or never written), not a regular file
 * of root's, writable by group or others, or not of the expected form; the caller then asks the daemon.
 * One stat per call; the file is mapped again only when it was replaced. */
enum kest_map_result kest_map_file_use(kest_map_use use, void *context);

#endif
