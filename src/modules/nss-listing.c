/* nss-listing.c - one walk of a name-service map (set, get, end), kept under a lock */
#include "nss-listing.h"

#include <stdlib.h>

static void drop(struct nss_listing *listing)
{
    free(listing->text);
    listing->text = NULL;
    listing->next = NULL;
    listing->taken = 0;
}

static void take_now(struct nss_listing *listing, nss_listing_take take)
{
    listing->taken = 1;
    take(listing);
}

enum nss_status nss_listing_restart(struct nss_listing *listing, nss_listing_take take)
{
    pthread_mutex_lock(&listing->lock);
    drop(listing);
    take_now(listing, take);
    pthread_mutex_unlock(&listing->lock);
    return NSS_STATUS_SUCCESS;
}

void nss_listing_lock(struct nss_listing *listing, nss_listing_take take)
{
    pthread_mutex_lock(&listing->lock);
    if (!listing->taken)
        take_now(listing, take);
}

enum nss_status nss_listing_end(struct nss_listing *listing)
{
    pthread_mutex_lock(&listing->lock);
    drop(listing);
    pthread_mutex_unlock(&listing->lock);
    return NSS_STATUS_SUCCESS;
}
