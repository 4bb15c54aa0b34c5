package telv.monitor;

import java.util.OptionalInt;

/**
 * The host health monitor in this JVM: libtelvzmnd's monitoring loop on a thread of its own, and
 * the switches that steer a running monitor.
 *
 * <p>One monitor runs in a process at a time: the loop keeps its state in the library. The
 * switches work through the shared control block, so they steer the monitor of whichever process
 * of the host made it, and change nothing (without failing) while no monitor has made one.
 *
 * <p>The native library {@code libtelvzjava.so} is loaded when the class is first used: from the
 * path in the system property {@value #LIBRARY_PROPERTY} when that is set, else by its name from
 * {@code java.library.path}. It needs {@code libtelvzmnd.so} and {@code libtelvplatform.so}
 * beside it.
 */
public final class HostMonitor {
    /** The system property that names the native library's file, instead of a search for it. */
    public static final String LIBRARY_PROPERTY = "telv.monitor.library";

    static {
        String path = System.getProperty(LIBRARY_PROPERTY);
        if (path != null && !path.isEmpty()) {
            System.load(path);
        } else {
            System.loadLibrary("telvzjava");
        }
    }

    private static HostMonitor current; // the last monitor started here; guarded by the class

    private final Thread thread;
    private int result; // the loop's system return code, written before its thread ends

    private HostMonitor(int checkingIntervalSeconds, boolean onePassOnly) {
        thread = new Thread(() -> result = monitorMain(checkingIntervalSeconds, onePassOnly),
                "telvzmnd monitor");
    }

    /**
     * Starts the monitor on a thread of its own and returns at once. The monitor reads its control
     * file {@code telvzopt.trm} from the platform's data directory; without one, or with one that
     * does not pass validation, it ends at once.
     *
     * @param checkingIntervalSeconds seconds between passes, in place of the control file's
     *     CHECKING_INTERVAL; below 5 means 60
     * @param onePassOnly one pass, and no sleep after it
     * @throws IllegalStateException while a monitor started here still runs
     */
    public static synchronized HostMonitor start(int checkingIntervalSeconds,
                                                 boolean onePassOnly) {
        if (current != null && current.isRunning()) {
            throw new IllegalStateException("a monitor is running in this process already");
        }
        current = new HostMonitor(checkingIntervalSeconds, onePassOnly);
        current.thread.start();
        return current;
    }

    /** Whether the monitor's thread still runs. */
    public boolean isRunning() {
        return thread.isAlive();
    }

    /**
     * Waits up to {@code millis} milliseconds (0: for good) for the monitor to end.
     *
     * @return its system return code (0 = fine, else its event log and trace say why), or empty
     *     when it still runs
     */
    public OptionalInt awaitEnd(long millis) throws InterruptedException {
        thread.join(millis);
        return thread.isAlive() ? OptionalInt.empty() : OptionalInt.of(result);
    }

    /**
     * Asks the monitor to end and returns at once. It ends after its current pass, or, while it
     * sleeps, after the pass that follows the sleep: up to one checking interval and one pass. An
     * informational event records the request.
     */
    public static native void stop();

    /** Makes the monitor's events informational ({@code true}) or errors again. */
    public static native void setInformationalEvents(boolean informational)
            throws HostMonitorException;

    /** Arms CPU checking again: the 11th pass from now judges it, and any finding is reported. */
    public static native void enableCpuAlerts() throws HostMonitorException;

    /** Holds CPU checking, and the check of the monitor's own sleep, off for the next 59 passes. */
    public static native void disableCpuAlerts() throws HostMonitorException;

    /**
     * Forces a sleep alert: the monitor ends its sleep within a second, and its next pass judges
     * the CPU and reports the alert.
     */
    public static native void triggerCpuAlert() throws HostMonitorException;

    /**
     * Sets memory limits, in kilobytes, for this process (0: the control file's default); six zeros
     * remove them again. They
     * hold while the monitor's listing of processes shows this one, and until the monitor restarts.
     *
     * @throws HostMonitorException for a limit below 0 or above 4,194,304 (src 2, crc naming the
     *     limit: 1 rss, 2 dsiz, 3 vsize, 5 rss abort, 6 dsiz abort, 7 vsize abort), or a full table
     */
    public static native void overrideThresholds(int rssKb, int dsizKb, int vsizeKb,
                                                 int rssAbortKb, int dsizAbortKb,
                                                 int vsizeAbortKb) throws HostMonitorException;

    /** The loop itself: returns when monitoring ends. */
    private static native int monitorMain(int checkingIntervalSeconds, boolean onePassOnly);

    /**
     * The event-class switch with its arguments given as the bridge sees them, each as an object:
     * one Boolean is what the switch takes; anything else it refuses.
     */
    static native void setLoggingTypeOf(Object... arguments) throws HostMonitorException;
}
