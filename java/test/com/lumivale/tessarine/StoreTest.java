package com.lumivale.tessarine;

import static com.lumivale.tessarine.TestSupport.bytes;
import static com.lumivale.tessarine.TestSupport.newFolder;
import static com.lumivale.tessarine.TestSupport.removeFolder;
import static com.lumivale.tessarine.TestSupport.rows;
import static com.lumivale.tessarine.TestSupport.text;
import static org.junit.Assert.assertEquals;
import static org.junit.Assert.assertFalse;
import static org.junit.Assert.assertThrows;
import static org.junit.Assert.assertTrue;

import java.nio.file.Path;
import java.util.ArrayList;
import java.util.Collections;
import java.util.List;
import org.junit.After;
import org.junit.Before;
import org.junit.Test;

/** One offline store: writes, queries, and how failures reach Java. */
public class StoreTest {
    private static final String ITEMS = "app:Items";
    private static final String BY_FIELD = "SELECT primary_key FROM {0} WHERE field_name = ? AND field_value = ?";

    private Path folder;
    private Tessarine store;
    private Collection items;

    // Objects hold "colour,size"; the indexer makes one row of each, and
    // throws for the primary key "bad".
    private static List<IndexEntry> index(String collectionName, String primaryKey, String sortKey, byte[] blob) {
        if (primaryKey.equals("bad")) throw new IllegalStateException("cannot index " + primaryKey);
        String[] fields = text(blob).split(",");
        return List.of(new IndexEntry("colour", fields[0]), new IndexEntry("size", fields[1]));
    }

    @Before
    public void open() throws Exception {
        folder = newFolder();
        store = Tessarine.open(folder.resolve("store.db").toString(), new TestSupport.OfflineTransport());
        store.setIndexer(StoreTest::index);
        store.start();
        items = store.subscribeCollection(ITEMS);
        String[][] objects = {{"a", "1", "red,3"}, {"b", "2", "blue,1"}, {"c", "3", "red,2"}, {"d", "4", "red,5"}};
        for (String[] object : objects) assertTrue(items.save(object[0], object[1], bytes(object[2])));
    }

    @After
    public void close() throws Exception {
        items.close();
        store.close();
        removeFolder(folder);
    }

    @Test
    public void queriesSelectSortAndLimitInBothDirections() {
        assertEquals(List.of("b=blue,1/PENDING", "c=red,2/PENDING", "d=red,5/PENDING"),
                     rows(items.query("2", -1, SortDirection.ASCENDING)));
        assertEquals(List.of("c=red,2/PENDING", "b=blue,1/PENDING"), rows(items.query("3", 2, SortDirection.DESCENDING)));

        List<String> red = rows(items.queryWithIndex(BY_FIELD, List.of("colour", "red"), -1));
        Collections.sort(red);
        assertEquals(List.of("a=red,3/PENDING", "c=red,2/PENDING", "d=red,5/PENDING"), red);
        assertEquals(List.of("d=red,5/PENDING", "a=red,3/PENDING"),
                     rows(items.queryWithIndex(BY_FIELD, List.of("colour", "red"), "size", SortDirection.DESCENDING, 2)));

        assertEquals(List.of("b=blue,1/PENDING"), rows(items.get("b")));
        assertTrue(items.delete("b"));
        assertEquals(List.of(), rows(items.get("b")));
    }

    @Test
    public void textAndBytesCrossUnchanged() {
        String key = "ключ-✓-\uD83D\uDE00";  // two- to four-byte UTF-8, a surrogate pair in Java
        byte[] blob = {0, (byte) 0xff, 'r', ',', '1', 0};
        assertTrue(items.save(key, key, blob));
        try (Cursor cursor = items.get(key)) {
            assertTrue(cursor.next());
            assertEquals(key, cursor.getPrimaryKey());
            assertEquals(key, cursor.getSortKey());
            assertEquals(List.of((byte) 0, (byte) 0xff), List.of(cursor.getBlob()[0], cursor.getBlob()[1]));
            assertEquals(blob.length, cursor.getBlob().length);
            assertFalse(cursor.next());
        }
    }

    @Test
    public void failuresReachJavaAsResultsOrExceptionsAndLoseNothing() throws Exception {
        assertThrows(TessarineException.class, () -> store.subscribeCollection("no_colon"));
        assertThrows(TessarineException.class, () -> items.queryWithIndex("NOT SQL {0}", List.of(), -1));
        assertThrows(TessarineException.class, () -> Wire.readServerPayload(new byte[] {1, 2, 3}));
        assertThrows(TessarineException.class,
                     () -> Tessarine.open(folder.resolve("missing/store.db").toString(), new TestSupport.OfflineTransport()));

        // A throwing indexer fails its save; a throwing listener does not,
        // and the listeners after it still hear of the change.
        List<String> heard = Collections.synchronizedList(new ArrayList<>());
        store.addChangeListener(changes -> { throw new IllegalStateException("listener fails"); });
        store.addChangeListener(changes -> changes.forEach(change -> heard.add(change.getPrimaryKey())));
        assertFalse(items.save("bad", "9", bytes("red,1")));
        assertTrue(items.save("e", "5", bytes("green,4")));
        assertEquals(List.of("e"), heard);
        assertEquals(List.of(), rows(items.get("bad")));
        assertEquals(5, rows(items.query("", -1, SortDirection.ASCENDING)).size());
    }

    @Test
    public void aTransportThatThrowsLeavesTheWriteStoredAndPending() throws Exception {
        SyncTransport failing = new TestSupport.OfflineTransport() {
            @Override
            public int sendDelta(SyncDelta delta) {
                throw new IllegalStateException("link broken");
            }
        };
        try (Tessarine other = Tessarine.open(folder.resolve("other.db").toString(), failing);
             Collection notes = other.subscribeCollection(ITEMS)) {
            other.start();
            assertTrue(notes.save("x", "1", bytes("red,1")));  // queued for the next connection
            assertEquals(List.of("x=red,1/PENDING"), rows(notes.query("", -1, SortDirection.ASCENDING)));
        }
    }
}
