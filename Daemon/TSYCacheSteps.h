// The steps that operations on existing containers take with the shared container cache, with the
// failures that all of them report. The caller holds the locks that the operation needs.
#pragma once

#include "Daemon/TSYContainerIdentity.h"
#include "Daemon/TSYError.h"
#include "Daemon/TSYMetadata.h"

// The very container. Code 21.
TSYResult<TSYMetadataRef> TSYFindContainer(const TSYConcreteContainerIdentity& identity);
// Enters it at `url`. Code 45.
TSYResult<void> TSYAddToCache(const TSYMetadata& container, const TSYURL& url, bool transient,
                              bool updateSandbox);
// Code 46.
TSYResult<void> TSYRemoveFromCache(const TSYMetadata& container);
