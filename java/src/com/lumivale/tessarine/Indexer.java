package com.lumivale.tessarine;

import java.util.List;

/**
 * Turns an object into index rows, which {@link Collection#queryWithIndex}
 * selects with SQL over the columns primary_key, field_name and field_value.
 * Called on every save, local or remote, on the saving thread, inside the
 * save's transaction; a field name may repeat. An exception it throws (or a
 * null result) is logged and fails the save, as a throwing native indexer
 * does: a local save returns false and stores nothing; a change from the
 * server is tried again by the store's worker after a pause.
 */
@FunctionalInterface
public interface Indexer {
    List<IndexEntry> index(String collectionName, String primaryKey, String sortKey, byte[] blob);
}
