package telv.monitor;

/**
 * A call into the monitor that failed: what went wrong, and the return codes of the call as the
 * monitor gives them, the system return code {@code src} and the component return code
 * {@code crc}. Both are unsigned 32-bit values held in an {@code int}; read them with
 * {@link Integer#toUnsignedLong(int)} when they may pass 2^31.
 */
public final class HostMonitorException extends Exception {
    private static final long serialVersionUID = 1L;

    private final int src;
    private final int crc;

    public HostMonitorException(String message, int src, int crc) {
        this(message, src, crc, null);
    }

    /** As above, with the exception that was pending in the native call when it failed. */
    public HostMonitorException(String message, int src, int crc, Throwable cause) {
        super(message, cause);
        this.src = src;
        this.crc = crc;
    }

    /** The system return code of the failed call: 0 = fine, else the class of the failure. */
    public int getSrc() {
        return src;
    }

    /** The component return code of the failed call: the detail of the failure. */
    public int getCrc() {
        return crc;
    }
}
