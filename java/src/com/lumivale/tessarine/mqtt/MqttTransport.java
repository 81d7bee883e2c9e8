package com.lumivale.tessarine.mqtt;

import com.lumivale.tessarine.NativeLibrary;
import com.lumivale.tessarine.NativeTransport;
import java.lang.ref.Reference;
import java.util.Objects;

/**
 * The native MQTT transport, handed to Tessarine.open: connects a store to
 * tessarine-server through an MQTT broker, in the background, reconnecting
 * with back-off. Use it for one store only.
 *
 * <pre>
 * MqttTransport.Options options = new MqttTransport.Options();
 * options.host = "broker.example";
 * try (MqttTransport transport = new MqttTransport(options);
 *      Tessarine store = Tessarine.open(path, transport)) { ... }
 * </pre>
 *
 * Threads: any application thread; never from a listener or indexer
 * (disconnect() joins the transport's network thread, which reports to the
 * store). The JNI library is tessarine_mqtt_jni, loaded from the file named by
 * the system property tessarine.mqtt.jni.library when set, otherwise from
 * java.library.path.
 */
public final class MqttTransport extends NativeTransport {
    static {
        NativeLibrary.load();
        String file = System.getProperty("tessarine.mqtt.jni.library");
        if (file != null && !file.isEmpty()) {
            System.load(file);
        } else {
            System.loadLibrary("tessarine_mqtt_jni");
        }
    }

    /** Where and how to connect; the defaults are those of the native transport. */
    public static final class Options {
        public String host = "127.0.0.1";
        public int port = 1883;
        /** Sent when not empty. */
        public String username = "";
        public String password = "";
        /** Not empty: TLS, with the broker's certificate checked against this CA file. */
        public String caFile = "";
        public int keepAliveSeconds = 30;
        /** Waits between connection attempts: from the minimum, doubling up to the maximum. */
        public int minReconnectDelaySeconds = 1;
        public int maxReconnectDelaySeconds = 30;
    }

    /**
     * A transport that connects once the store is started. IllegalArgumentException
     * for a negative delay; TessarineException for options the native side
     * cannot use (a CA file that cannot be read, say).
     */
    public MqttTransport(Options options) {
        super(create(Objects.requireNonNull(options, "options")));
    }

    private static long create(Options options) {
        if (options.minReconnectDelaySeconds < 0 || options.maxReconnectDelaySeconds < 0) {
            throw new IllegalArgumentException("reconnect delays must not be negative");
        }
        return nativeCreate(options.host, options.port, options.username, options.password, options.caFile,
                            options.keepAliveSeconds, options.minReconnectDelaySeconds,
                            options.maxReconnectDelaySeconds);
    }

    /** Connects again after disconnect(); the store resends what it queued meanwhile. */
    public void connect() {
        try {
            nativeConnect(pointer(), true);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** Takes the connection down until connect(), as an app going to the background; changes stay PENDING. */
    public void disconnect() {
        try {
            nativeConnect(pointer(), false);
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    /** True while connected to the broker. */
    public boolean isConnected() {
        try {
            return nativeIsConnected(pointer());
        } finally {
            Reference.reachabilityFence(this);
        }
    }

    private static native long nativeCreate(String host, int port, String username, String password, String caFile,
                                            int keepAliveSeconds, int minReconnectDelaySeconds,
                                            int maxReconnectDelaySeconds);

    private static native void nativeConnect(long sharedProtocolPointer, boolean up);

    private static native boolean nativeIsConnected(long sharedProtocolPointer);
}
