package com.lumivale.tessarine;

import static com.lumivale.tessarine.TestSupport.bytes;
import static com.lumivale.tessarine.TestSupport.newFolder;
import static com.lumivale.tessarine.TestSupport.removeFolder;
import static com.lumivale.tessarine.TestSupport.rows;
import static com.lumivale.tessarine.TestSupport.waitUntil;
import static org.junit.Assert.assertTrue;

import com.lumivale.tessarine.mqtt.MqttTransport;
import java.io.IOException;
import java.net.InetSocketAddress;
import java.net.ServerSocket;
import java.net.Socket;
import java.nio.file.Files;
import java.nio.file.Path;
import java.util.List;
import java.util.Set;
import java.util.concurrent.ConcurrentHashMap;
import org.junit.After;
import org.junit.Test;

/**
 * Two stores on the native MQTT transport sync through a real broker
 * (mosquitto) and the networked server program, both child processes on a
 * free port of 127.0.0.1.
 */
public class MqttTransportTest {
    private static final String NOTES = "app:Notes";
    private static final String LOOPBACK = "127.0.0.1";

    private final Path folder;
    private Process broker;
    private Process server;

    public MqttTransportTest() throws IOException {
        folder = newFolder();
    }

    @After
    public void stopChildren() throws Exception {
        for (Process process : new Process[] {server, broker}) {
            if (process != null) {
                process.destroy();
                process.waitFor();
            }
        }
        removeFolder(folder);
    }

    private static int freePort() throws IOException {
        try (ServerSocket socket = new ServerSocket(0, 1, java.net.InetAddress.getByName(LOOPBACK))) {
            return socket.getLocalPort();
        }
    }

    private static boolean accepts(int port) {
        try (Socket socket = new Socket()) {
            socket.connect(new InetSocketAddress(LOOPBACK, port), 1000);
            return true;
        } catch (IOException e) {
            return false;
        }
    }

    private int startBroker() throws Exception {
        int port = freePort();
        StringBuilder config = new StringBuilder("listener " + port + " " + LOOPBACK + "\nallow_anonymous true\n"
                                                + "log_type error\nlog_type warning\n");
        // As root, mosquitto would otherwise switch to a user that may not read the temporary folder.
        if ("root".equals(System.getProperty("user.name"))) config.append("user root\n");
        Path file = Files.writeString(folder.resolve("mosquitto.conf"), config);
        broker = new ProcessBuilder("mosquitto", "-c", file.toString()).inheritIO().start();
        waitUntil("the broker accepts connections", () -> accepts(port));
        return port;
    }

    /** "key STATUS" for every change the store's listener hears. */
    private static Set<String> listen(Tessarine store) {
        Set<String> heard = ConcurrentHashMap.newKeySet();
        store.addChangeListener(changes -> {
            for (Change change : changes) heard.add(change.getPrimaryKey() + " " + change.getStatus());
        });
        return heard;
    }

    @Test
    public void storesOnMqttTransportsSyncThroughTheBrokerAndTheServer() throws Exception {
        int port = startBroker();
        server = new ProcessBuilder(System.getProperty("tessarine.server.program"), "--broker-port",
                                    Integer.toString(port), "--data", folder.resolve("server.db").toString())
                     .inheritIO().start();
        MqttTransport.Options options = new MqttTransport.Options();
        options.port = port;
        try (MqttTransport phoneLink = new MqttTransport(options);
             MqttTransport tabletLink = new MqttTransport(options);
             Tessarine phone = Tessarine.open(folder.resolve("phone.db").toString(), phoneLink);
             Tessarine tablet = Tessarine.open(folder.resolve("tablet.db").toString(), tabletLink)) {
            Set<String> phoneHeard = listen(phone);
            Set<String> tabletHeard = listen(tablet);
            phone.start();
            tablet.start();
            try (Collection phoneNotes = phone.subscribeCollection(NOTES);
                 Collection tabletNotes = tablet.subscribeCollection(NOTES)) {
                waitUntil("both transports are connected", () -> phoneLink.isConnected() && tabletLink.isConnected());
                assertTrue(phoneNotes.save("n1", "1", bytes("Buy milk")));
                waitUntil("the tablet hears the phone's note and the phone hears it PERSISTED",
                          () -> tabletHeard.contains("n1 PERSISTED") && phoneHeard.contains("n1 PERSISTED"));
                waitUntil("the tablet holds the note",
                          () -> rows(tabletNotes.get("n1")).equals(List.of("n1=Buy milk/PERSISTED")));
            }
        }
    }
}
