package com.lumivale.tessarine;

import static com.lumivale.tessarine.TestSupport.bytes;
import static com.lumivale.tessarine.TestSupport.newFolder;
import static com.lumivale.tessarine.TestSupport.removeFolder;
import static com.lumivale.tessarine.TestSupport.rows;
import static com.lumivale.tessarine.TestSupport.waitUntil;
import static org.junit.Assert.assertEquals;
import static org.junit.Assert.assertFalse;
import static org.junit.Assert.assertThrows;
import static org.junit.Assert.assertTrue;

import com.lumivale.tessarine.server.LoopbackTransport;
import com.lumivale.tessarine.server.ReferenceServer;
import java.lang.ref.WeakReference;
import java.nio.file.Path;
import java.util.List;
import java.util.concurrent.atomic.AtomicBoolean;
import org.junit.After;
import org.junit.Before;
import org.junit.Test;

/** Closing, closed handles and garbage collection of unclosed objects. */
public class LifetimeTest {
    private static final String ITEMS = "app:Items";

    private Path folder;

    @Before
    public void makeFolder() throws Exception {
        folder = newFolder();
    }

    @After
    public void removeFiles() throws Exception {
        removeFolder(folder);
    }

    private Tessarine openOffline(String name) {
        return Tessarine.open(folder.resolve(name).toString(), new TestSupport.OfflineTransport());
    }

    @Test
    public void closedHandlesThrowIllegalStateAndCloseTwiceIsHarmlessAndCollectionsOutliveTheirStore() {
        Tessarine store = openOffline("store.db");
        Collection items = store.subscribeCollection(ITEMS);
        store.close();
        store.close();
        assertThrows(IllegalStateException.class, store::start);
        assertThrows(IllegalStateException.class, () -> store.subscribeCollection(ITEMS));

        assertTrue(items.save("a", "1", bytes("x")));  // the collection keeps the store's parts alive
        assertEquals(List.of("a=x/PENDING"), rows(items.query("", -1, SortDirection.ASCENDING)));
        Cursor cursor = items.get("a");
        assertThrows(IllegalStateException.class, cursor::getPrimaryKey);  // before next()
        assertTrue(cursor.next());
        assertEquals("a", cursor.getPrimaryKey());
        assertFalse(cursor.next());
        assertThrows(IllegalStateException.class, cursor::getBlob);  // after the end
        cursor.close();
        cursor.close();
        assertThrows(IllegalStateException.class, cursor::next);
        items.close();
        items.close();
        assertThrows(IllegalStateException.class, () -> items.save("b", "2", bytes("y")));
    }

    // Opens a synced store, writes so that its worker calls into Java, and
    // drops everything unclosed.
    private WeakReference<Tessarine> useAndForget(ReferenceServer server, String name) throws Exception {
        LoopbackTransport transport = server.newLoopbackTransport(1);
        Tessarine store = Tessarine.open(folder.resolve(name).toString(), transport);
        AtomicBoolean persisted = new AtomicBoolean();
        store.addChangeListener(changes -> persisted.compareAndSet(false, changes.get(0).getStatus() == Status.PERSISTED));
        store.start();
        Collection items = store.subscribeCollection(ITEMS);
        assertTrue(items.save("a", "1", bytes("x")));
        waitUntil("the worker reports PERSISTED", persisted::get);
        Cursor cursor = items.query("", -1, SortDirection.ASCENDING);
        assertTrue(cursor.next());
        return new WeakReference<>(store);
    }

    @Test
    public void unclosedObjectsAreReleasedByTheGarbageCollector() throws Exception {
        try (ReferenceServer server = new ReferenceServer()) {
            List<WeakReference<Tessarine>> stores = List.of(useAndForget(server, "one.db"), useAndForget(server, "two.db"));
            waitUntil("the stores are collected and their workers gone", () -> {
                System.gc();
                return stores.stream().allMatch(store -> store.get() == null)
                       && Thread.getAllStackTraces().keySet().stream()
                              .noneMatch(thread -> thread.getName().equals("tessarine-native"));
            });
        }
    }
}
