package telv.monitor;

import java.io.IOException;
import java.io.PrintWriter;
import java.io.StringWriter;
import java.nio.charset.StandardCharsets;
import java.nio.file.Files;
import java.nio.file.NoSuchFileException;
import java.nio.file.Path;
import java.util.ArrayList;
import java.util.Arrays;
import java.util.List;
import java.util.OptionalInt;
import java.util.concurrent.TimeUnit;
import java.util.function.BooleanSupplier;
import java.util.regex.Matcher;
import java.util.regex.Pattern;
import java.util.stream.Collectors;

/**
 * HostMonitor in a real JVM, one scenario a run: {@code java telv.monitor.HostMonitorTest
 * SCENARIO}, or {@link #run(String, String)} from a program that made the JVM. The data directory
 * ({@code TELV_DATA_DIR}) holds a control file that a quiet host passes, and the commands that the
 * checks run are quiet fakes first on {@code PATH}, so the only events are those a scenario causes.
 * The system property {@code telv.test.tarnmon} names the tarnmon program.
 */
public final class HostMonitorTest {
    private static final long LIMIT_MILLIS = 120_000; // far more than a pass takes, sanitized too
    private static final int LONG_INTERVAL = 20; // seconds; far more than a cut sleep takes

    // The files of the platform in the data directory of the scenario that runs.
    private static Path traceFile;
    private static Path eventLog;

    private static final String PASS = "TARNMNDF: inside while loop";
    private static final String SLEPT = "TARNMNDF: slept for 1 second;";

    private static final List<String> failures = new ArrayList<>();
    private static HostMonitor started; // the last monitor a scenario started

    /** Exits with 0 when every check held, else with 1 and the failures on standard error. */
    public static void main(String[] arguments) {
        String scenario = arguments.length == 1 ? arguments[0] : "";
        String failed = run(scenario, System.getenv("TELV_DATA_DIR"));
        if (!failed.isEmpty()) {
            System.err.println(failed);
        }
        // exit, not return: a monitor thread that a failure left running would keep the JVM up.
        System.exit(failed.isEmpty() ? 0 : 1);
    }

    /**
     * Runs one scenario over the data directory that the platform uses (TELV_DATA_DIR), and leaves
     * no monitor running; returns the failures, a line each, or "" when every check held.
     */
    public static String run(String scenario, String dataDirectory) {
        failures.clear();
        started = null;
        traceFile = Path.of(dataDirectory, "telvzmnd.trace");
        eventLog = Path.of(dataDirectory, "telvzmnd.events");
        try {
            switch (scenario) {
                case "refusals" -> refusals();
                case "switches" -> switches();
                case "stop" -> stop();
                case "once" -> once();
                default -> fail("no such scenario: '" + scenario + "'");
            }
        } catch (Throwable thrown) {
            StringWriter trace = new StringWriter();
            thrown.printStackTrace(new PrintWriter(trace));
            fail("the scenario ended with " + trace);
        }
        if (started != null && started.isRunning()) {
            fail("the monitor still ran at the end: stopped");
            try {
                HostMonitor.stop();
                HostMonitor.triggerCpuAlert(); // ends its sleep: the pass after it is the last
                started.awaitEnd(LIMIT_MILLIS);
            } catch (HostMonitorException | InterruptedException e) {
                fail("it could not be stopped: " + e);
            }
        }
        return failures.stream().map(failure -> "FAILED: " + failure + "\n")
                .collect(Collectors.joining());
    }

    // ---- Scenarios ----

    /** Without a monitor: what the switches refuse, and that they refuse nothing else. */
    static void refusals() throws Exception {
        // No control block exists: every switch changes nothing and succeeds.
        HostMonitor.setInformationalEvents(true);
        HostMonitor.setInformationalEvents(false);
        HostMonitor.enableCpuAlerts();
        HostMonitor.disableCpuAlerts();
        HostMonitor.triggerCpuAlert();
        HostMonitor.overrideThresholds(100, 200, 300, 0, 0, 0);
        HostMonitor.setLoggingTypeOf(Boolean.TRUE);

        String fetch = "Unable to fetch the requested logging type parameter; "
                + "jcbGetBooleanArgument() rc=%d, msg=\"%s\"";
        expectRefusal(() -> HostMonitor.setLoggingTypeOf(42),
                String.format(fetch, 5, "argument 1 is a java.lang.Integer, not a boolean"), 22, 0);
        expectRefusal(() -> HostMonitor.setLoggingTypeOf("true"),
                String.format(fetch, 5, "argument 1 is a java.lang.String, not a boolean"), 22, 0);
        expectRefusal(() -> HostMonitor.setLoggingTypeOf((Object) null),
                String.format(fetch, 5, "argument 1 is null, not a boolean"), 22, 0);
        expectRefusal(() -> HostMonitor.setLoggingTypeOf(),
                String.format(fetch, 4, "the call has no argument 1: it was given 0"), 22, 0);

        String override = "tarn_override_thresholds() failed with system rc=2 and component rc=%d";
        expectRefusal(() -> HostMonitor.overrideThresholds(4_194_305, 0, 0, 0, 0, 0),
                String.format(override, 1), 2, 1);
        // The last refused limit names the failure.
        expectRefusal(() -> HostMonitor.overrideThresholds(-1, 0, 0, 0, 0, 5_000_000),
                String.format(override, 7), 2, 7);
        HostMonitor.overrideThresholds(4_194_304, 0, 0, 0, 0, 0);

        check(read(eventLog).isEmpty(), "no event without a monitor: " + read(eventLog));
    }

    /**
     * A running monitor: limits set for this process, a forced sleep alert that ends the sleep
     * within a second, its event informational and then an error again, and the end.
     */
    static void switches() throws Exception {
        HostMonitor monitor = started = HostMonitor.start(LONG_INTERVAL, false);
        String sleep = "TARNMNDF: about to sleep for " + LONG_INTERVAL + " seconds";
        awaitTrace(sleep, 1);
        check(read(eventLog).isEmpty(), "the quiet pass raised no event: " + read(eventLog));
        try {
            HostMonitor.start(LONG_INTERVAL, false);
            fail("a second monitor started while the first runs");
        } catch (IllegalStateException expected) {
            check(monitor.isRunning(), "the first monitor runs on");
        }

        // The limits reach the control block, as another process lists them.
        HostMonitor.overrideThresholds(100, 200, 300, 0, 0, 0);
        String pid = Long.toString(ProcessHandle.current().pid());
        String listing = tarnmon("overrides");
        check(listing.lines().map(line -> List.of(line.trim().split(" +")))
                        .anyMatch(row -> row.size() == 10 && row.get(1).equals(pid)
                                && row.subList(2, 8).equals(
                                        List.of("100", "200", "300", "0", "0", "0"))),
                "this JVM's limits in the table:\n" + listing);

        HostMonitor.setInformationalEvents(true);
        forcedSleepAlert(2);
        checkEvent(0, "0xE153", "informational");

        awaitTrace(sleep, 2);
        HostMonitor.setInformationalEvents(false);
        forcedSleepAlert(3);
        checkEvent(1, "0xE153", "error");

        // The request is seen at the end of the pass after the sleep; a forced alert ends the
        // sleep, so that pass comes at once.
        awaitTrace(sleep, 3);
        HostMonitor.stop();
        check(monitor.isRunning(), "the monitor sleeps on after the request");
        HostMonitor.triggerCpuAlert();
        checkEnd(monitor);
        check(count(read(traceFile), PASS) == 4, "four passes:\n" + read(traceFile));
        List<String> events = events();
        check(events.size() == 4, "the terminate request's event and the third alert: " + events);
        checkEvent(2, "0xE170", "informational");
        checkEvent(3, "0xE153", "error");
    }

    /** A stop during the sleep ends the monitor after the pass that follows the sleep. */
    static void stop() throws Exception {
        HostMonitor monitor = started = HostMonitor.start(5, false);
        awaitTrace("TARNMNDF: about to sleep for 5 seconds", 1);
        HostMonitor.stop();
        checkEnd(monitor);
        String trace = read(traceFile);
        check(count(trace, PASS) == 2, "the pass before the request and one after:\n" + trace);
        check(count(trace, SLEPT) == 5, "the whole sleep between them:\n" + trace);
        List<String> events = events();
        check(events.size() == 1, "only the terminate request's event: " + events);
        checkEvent(0, "0xE170", "informational");
        started = HostMonitor.start(5, true);
        check(started.awaitEnd(LIMIT_MILLIS).orElse(-1) == 0,
                "a monitor starts again once the first has ended, and runs its pass");
    }

    /** One pass only: the monitor ends by itself, without a sleep. */
    static void once() throws Exception {
        HostMonitor monitor = started = HostMonitor.start(5, true);
        checkEnd(monitor);
        String trace = read(traceFile);
        check(count(trace, PASS) == 1, "one pass:\n" + trace);
        check(trace.contains("TARNMNDF:    runOnce = TRUE"), "run once:\n" + trace);
        check(trace.contains("TARNMNDF:    checking_interval = 5 seconds"), "the interval given");
        check(!trace.contains("TARNMNDF: about to sleep"), "no sleep:\n" + trace);
        check(read(eventLog).isEmpty(), "no event: " + read(eventLog));
    }

    // ---- Steps ----

    /**
     * Forces a sleep alert while the monitor sleeps: the sleep ends within a second (at most one
     * more second is slept), and pass `pass` reports the alert, with no sleep overrun (0xE153).
     */
    static void forcedSleepAlert(int pass) throws Exception {
        int events = events().size();
        HostMonitor.triggerCpuAlert();
        // Counted after the trigger: a second that ended just before it is not the sleep's fault.
        int slept = count(read(traceFile), SLEPT);
        awaitTrace(PASS, pass);
        String trace = read(traceFile);
        String after = trace.substring(0, nthIndex(trace, PASS, pass));
        check(count(after, SLEPT) <= slept + 1,
                "at most one second slept after the alert was forced:\n" + trace);
        await(() -> events().size() > events, "the event of pass " + pass);
    }

    static void checkEnd(HostMonitor monitor) throws InterruptedException {
        OptionalInt src = monitor.awaitEnd(LIMIT_MILLIS);
        check(src.isPresent(), "the monitor ended");
        check(src.orElse(-1) == 0, "the monitor ended with src 0, not " + src);
        check(!monitor.isRunning(), "its thread is gone");
    }

    /** Event `index` of the log: of the monitor, with this reason and severity. */
    static void checkEvent(int index, String reason, String severity) {
        List<String> events = events();
        if (index >= events.size()) {
            fail("no event " + index + ": " + events);
            return;
        }
        String event = events.get(index);
        check(field(event, "component").equals("LinMonitor"), "of the monitor: " + event);
        check(field(event, "reason").equals(reason), "reason " + reason + ": " + event);
        check(field(event, "severity").equals(severity), severity + ": " + event);
    }

    interface Refused {
        void call() throws HostMonitorException;
    }

    static void expectRefusal(Refused call, String message, int src, int crc) {
        try {
            call.call();
            fail("no exception, where \"" + message + "\" was due");
        } catch (HostMonitorException e) {
            check(message.equals(e.getMessage()),
                    "message\n  \"" + e.getMessage() + "\", not\n  \"" + message + "\"");
            check(e.getSrc() == src, "src " + e.getSrc() + ", not " + src + ": " + message);
            check(e.getCrc() == crc, "crc " + e.getCrc() + ", not " + crc + ": " + message);
            check(e.getCause() == null, "no cause: " + e.getCause());
        }
    }

    // ---- Helpers ----

    static String tarnmon(String... arguments) throws IOException, InterruptedException {
        List<String> command = new ArrayList<>();
        command.add(System.getProperty("telv.test.tarnmon"));
        command.addAll(Arrays.asList(arguments));
        Process process = new ProcessBuilder(command).redirectErrorStream(true).start();
        String output = new String(process.getInputStream().readAllBytes(), StandardCharsets.UTF_8);
        check(process.waitFor() == 0, "tarnmon " + String.join(" ", arguments) + ": " + output);
        return output;
    }

    static String read(Path path) {
        try {
            return Files.readString(path, StandardCharsets.ISO_8859_1);
        } catch (NoSuchFileException absent) {
            return "";
        } catch (IOException e) {
            fail("cannot read " + path + ": " + e);
            return "";
        }
    }

    static List<String> events() {
        return read(eventLog).lines().toList();
    }

    /** A string field of an event's JSON line, as the event log writes it. */
    static String field(String event, String name) {
        Matcher m = Pattern.compile("\"" + name + "\":\"([^\"]*)\"").matcher(event);
        return m.find() ? m.group(1) : "";
    }

    static int count(String text, String part) {
        int count = 0;
        for (int at = text.indexOf(part); at >= 0; at = text.indexOf(part, at + part.length())) {
            ++count;
        }
        return count;
    }

    /** Where the `n`th (from 1) `part` of `text` begins; the text's length when it has fewer. */
    static int nthIndex(String text, String part, int n) {
        int at = -part.length();
        for (int i = 0; i < n; ++i) {
            at = text.indexOf(part, at + part.length());
            if (at < 0) {
                return text.length();
            }
        }
        return at;
    }

    static void awaitTrace(String line, int times) throws InterruptedException {
        await(() -> count(read(traceFile), line) >= times, times + " x \"" + line + "\"");
    }

    /** Waits for `ready`; a scenario whose wait is in vain ends there. */
    static void await(BooleanSupplier ready, String what) throws InterruptedException {
        long deadline = System.nanoTime() + TimeUnit.MILLISECONDS.toNanos(LIMIT_MILLIS);
        while (!ready.getAsBoolean()) {
            if (System.nanoTime() > deadline) {
                throw new IllegalStateException("waited in vain for " + what);
            }
            Thread.sleep(20);
        }
    }

    static void check(boolean condition, String what) {
        if (!condition) {
            fail(what);
        }
    }

    static void fail(String what) {
        failures.add(what);
    }
}
