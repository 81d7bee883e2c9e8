package com.lumivale.tessarine;

/**
 * Loads the JNI library once per process: from the file named by the system
 * property tessarine.jni.library when set (tests, apps that unpack it
 * themselves), otherwise as "tessarine_jni" from java.library.path (on
 * Android, the app's own lib/ABI folder).
 */
public final class NativeLibrary {
    private static boolean loaded;

    private NativeLibrary() {}

    public static synchronized void load() {
        if (loaded) return;
        String file = System.getProperty("tessarine.jni.library");
        if (file != null && !file.isEmpty()) {
            System.load(file);
        } else {
            System.loadLibrary("tessarine_jni");
        }
        loaded = true;
    }
}
