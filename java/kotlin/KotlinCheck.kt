// The Kotlin check: a small program that uses the store as a Kotlin app
// would (lambdas for the listener and indexer, use {} on every closeable,
// sequences over a cursor) and exits non-zero when a result is not the
// expected one.
import com.lumivale.tessarine.ChangeType
import com.lumivale.tessarine.Cursor
import com.lumivale.tessarine.IndexEntry
import com.lumivale.tessarine.SortDirection
import com.lumivale.tessarine.Status
import com.lumivale.tessarine.SubscriptionRequest
import com.lumivale.tessarine.SyncDelta
import com.lumivale.tessarine.SyncTransport
import com.lumivale.tessarine.Tessarine
import com.lumivale.tessarine.TessarineException
import com.lumivale.tessarine.TransportEvents
import java.nio.file.Files
import java.util.concurrent.CopyOnWriteArrayList
import kotlin.system.exitProcess

data class Task(val id: String, val title: String, val done: Boolean)

fun Task.toBytes(): ByteArray = "$title|$done".toByteArray()

// The tasks a cursor selects, read lazily and closed at the end.
fun Cursor.tasks(): List<Task> = use { cursor ->
    generateSequence { if (cursor.next()) cursor else null }
        .map { row ->
            val (title, done) = String(row.blob).split("|")
            Task(row.primaryKey, title, done.toBoolean())
        }
        .toList()
}

// The store works offline here: the transport never connects.
object Offline : SyncTransport {
    override fun start(events: TransportEvents) {}
    override fun sendSubscriptionRequest(request: SubscriptionRequest) {}
    override fun sendDelta(delta: SyncDelta): Int = 0
    override fun sendSnapshotRequest(collectionName: String, clientId: String) {}
}

fun check(what: String, condition: Boolean) {
    if (!condition) {
        System.err.println("FAILED: $what")
        exitProcess(1)
    }
}

fun main() {
    val folder = Files.createTempDirectory("tessarine-kotlin-")
    val heard = CopyOnWriteArrayList<String>()
    try {
        Tessarine.open(folder.resolve("tasks.db").toString(), Offline).use { store ->
            store.addChangeListener { changes -> changes.forEach { heard += "${it.type} ${it.primaryKey} ${it.status}" } }
            store.setIndexer { _, _, _, blob ->
                listOf(IndexEntry("done", String(blob).substringAfter("|")))
            }
            store.start()
            store.subscribeCollection("todo:Tasks").use { tasks ->
                val all = listOf(Task("t1", "Write", true), Task("t2", "Test", false), Task("t3", "Ship", false))
                all.forEach { check("save ${it.id}", tasks.save(it.id, it.id, it.toBytes())) }
                check("delete t3", tasks.delete("t3"))

                val open = tasks.queryWithIndex(
                    "SELECT primary_key FROM {0} WHERE field_name = ? AND field_value = ?",
                    listOf("done", "false"), "done", SortDirection.ASCENDING, -1).tasks()
                check("open tasks: $open", open == listOf(Task("t2", "Test", false)))
                val newestFirst = tasks.query("t9", -1, SortDirection.DESCENDING).tasks().map { it.id }
                check("newest first: $newestFirst", newestFirst == listOf("t2", "t1"))
                val status = tasks.get("t1").use { if (it.next()) it.status else null }
                check("t1 is pending offline: $status", status == Status.PENDING)
                val failed = runCatching { store.subscribeCollection("no colon") }.exceptionOrNull()
                check("an invalid name throws: $failed", failed is TessarineException)
            }
        }
        check("listener heard: $heard", heard == listOf("SAVE t1 PENDING", "SAVE t2 PENDING", "SAVE t3 PENDING",
                                                       "${ChangeType.DELETE} t3 PENDING"))
    } finally {
        folder.toFile().deleteRecursively()
    }
    println("Kotlin check passed")
}
