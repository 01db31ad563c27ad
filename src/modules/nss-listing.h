/* nss-listing.h - one walk of a name-service map (set, get, end), kept under a lock */
#ifndef KEST_NSS_LISTING_H
#define KEST_NSS_LISTING_H

#include <nss.h>
#include <pthread.h>

/* glibc serialises a process's walks already; the lock keeps the list sound for any other caller. */
struct nss_listing {
    pthread_mutex_t lock;
    char *text; /* what the map fetched for the walk, freed with it */
    const char *next; /* where the next entry starts; NULL when there is none */
    int taken;
};
#define NSS_LISTING_INIT                                                                                               \
    {                                                                                                                  \
        PTHREAD_MUTEX_INITIALIZER, NULL, NULL, 0                                                                       \
    }

/* Fills text and next for a new walk; called under the lock. */
typedef void (*nss_listing_take)(struct nss_listing *listing);

/* setXXent: a new walk. */
enum nss_status nss_listing_restart(struct nss_listing *listing, nss_listing_take take);
/* getXXent: locks the walk, taking the list first when no set call did; unlock with pthread_mutex_unlock. */
void nss_listing_lock(struct nss_listing *listing, nss_listing_take take);
/* endXXent. */
enum nss_status nss_listing_end(struct nss_listing *listing);

#endif
