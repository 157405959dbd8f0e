import com.orvane.quill.flowgauge.core.ft.client.FileTransferClient;

import java.io.*;
import java.lang.management.ManagementFactory;
import java.nio.file.*;
import java.util.*;
import java.util.concurrent.*;
import java.util.function.Consumer;
import java.util.stream.*;

/**
 * FileTransferClient against real hubs in separate processes. The natives
 * read their hub, depot root, product and node name from the environment, so
 * for each scenario this driver starts a location broker (dpx-lbd, on a port
 * it picks itself) and one JVM, with the scenario's environment and its own
 * JVM flags (-Xcheck:jni), that starts its hub and runs the checks. The driver adds up the counts and fails a scenario on any
 * -Xcheck:jni warning.
 *
 * usage: FileTransferClientTest AGENTD TEST_PEER SCENARIO... (daemon, peer, names, unset)
 */
public class FileTransferClientTest {
    static final int INVALID_PARAM = -249692159;
    static final String ORIGIN = "origin-7";
    static int passed, failed;

    static void check(boolean ok, String what) {
        if (ok) {
            passed++;
        } else {
            failed++;
            System.out.println("FAIL: " + what);
        }
    }

    static void checkEquals(Object expected, Object actual, String what) {
        check(Objects.equals(expected, actual), what + ": expected <" + expected + "> got <" + actual + ">");
    }

    public static void main(String[] args) throws Exception {
        if (args[0].equals("--scenario"))
            runScenario(args[1], args[2], args[3], Path.of(args[4]));
        else
            for (int i = 2; i < args.length; i++)
                drive(args[0], args[1], args[i]);
        System.out.println(passed + " passed, " + failed + " failed");
        System.exit(failed == 0 ? 0 : 1);
    }

    // ---- Driver ------------------------------------------------------------

    static void drive(String agentd, String peer, String scenario) throws Exception {
        Path work = Files.createTempDirectory("ftc-" + scenario);
        List<String> command = new ArrayList<>(List.of(Path.of(System.getProperty("java.home"), "bin", "java") + ""));
        command.addAll(ManagementFactory.getRuntimeMXBean().getInputArguments());
        command.addAll(List.of("-cp", System.getProperty("java.class.path"), "FileTransferClientTest",
                               "--scenario", scenario, agentd, peer, work.toString()));
        // -Xcheck:jni warns on standard output, the JVM's own messages go to standard error: both are read.
        // The broker takes a free port and tells it: no port to guess and race for.
        ProcessBuilder brokerBuilder = new ProcessBuilder(Path.of(agentd).resolveSibling("dpx-lbd").toString())
                                           .redirectError(ProcessBuilder.Redirect.INHERIT);
        brokerBuilder.environment().putAll(Map.of("NCS_LB_PORT", "0", "TRC1_FLAGS", "0x80"));
        Process broker = brokerBuilder.start();
        String listening = new BufferedReader(new InputStreamReader(broker.getInputStream())).readLine();
        check(listening != null && listening.startsWith("listening on "), scenario + ": the broker starts");
        String brokerPort = listening == null ? "0" : listening.substring(listening.lastIndexOf(':') + 1);
        ProcessBuilder builder = new ProcessBuilder(command).redirectErrorStream(true);
        Map<String, String> env = builder.environment();
        env.keySet().removeAll(List.of("DPX_DEPOTROOT", "VESPERHOME", "AFW_PRODUCT", "AFW_HUB_HOST"));
        env.putAll(Map.of("DPX_HUBHOST", "127.0.0.1", "NCS_LB_PORT", brokerPort, "AFW_ORIGIN_NODE", ORIGIN));
        if (scenario.equals("daemon"))
            env.putAll(Map.of("DPX_DEPOTROOT", work.resolve("depot").toString(), "AFW_PRODUCT", "prod"));
        Process child = builder.start();
        List<String> warnings = new ArrayList<>();
        List<String> counts = new ArrayList<>();
        forEachLine(child.getInputStream(), line -> {
            System.out.println("[" + scenario + "] " + line);
            if (line.contains("WARNING"))
                warnings.add(line);
            if (line.matches("\\d+ passed, \\d+ failed"))
                counts.add(line);
        });
        check(child.waitFor() == 0, scenario + ": the JVM runs its checks and exits with 0");
        broker.destroy();
        broker.waitFor();
        check(counts.size() == 1, scenario + ": the JVM reports its counts");
        for (String line : counts) {
            passed += Integer.parseInt(line.split(" ")[0]);
            failed += Integer.parseInt(line.split(" ")[2]);
        }
        check(warnings.isEmpty(), scenario + ": no -Xcheck:jni warnings, saw " + warnings);
        deleteTree(work);
    }

    /** Hands each line to sink until the stream ends or is closed. */
    static void forEachLine(InputStream stream, Consumer<String> sink) {
        try (BufferedReader reader = new BufferedReader(new InputStreamReader(stream))) {
            for (String line; (line = reader.readLine()) != null; )
                sink.accept(line);
        } catch (IOException closed) {
            // A process that ends closes its streams: no more lines.
        }
    }

    static void deleteTree(Path root) throws IOException {
        try (var paths = Files.walk(root)) {
            for (Path p : paths.sorted(Comparator.reverseOrder()).toList())
                Files.delete(p);
        }
    }

    // ---- Hub processes -----------------------------------------------------

    /** A hub program on the broker port of this JVM's environment; stopped when the JVM ends. */
    static final class Hub {
        final BlockingQueue<String> lines = new LinkedBlockingQueue<>();

        Hub(Path work, String... command) throws Exception {
            Process process = new ProcessBuilder(command).redirectError(work.resolve("hub.err").toFile()).start();
            Runtime.getRuntime().addShutdownHook(new Thread(() -> {
                process.destroy();
                process.onExit().completeOnTimeout(process, 10, TimeUnit.SECONDS).join();
            }));
            // Drained all along: the test peer prints a line per call.
            Thread reader = new Thread(() -> forEachLine(process.getInputStream(), lines::add));
            reader.setDaemon(true);
            reader.start();
            String first = next();
            if (first == null || !first.startsWith("listening on "))
                throw new IllegalStateException(command[0] + " did not start: "
                                                + Files.readString(work.resolve("hub.err")));
        }

        /** The next line the hub printed, or null after 30 seconds without one. */
        String next() throws InterruptedException {
            return lines.poll(30, TimeUnit.SECONDS);
        }
    }

    // ---- Scenarios, each in a JVM of its own ------------------------------

    static void runScenario(String scenario, String agentd, String peer, Path work) throws Exception {
        FileTransferClient client = new FileTransferClient();
        switch (scenario) {
            case "daemon" -> {
                new Hub(work, agentd, "--depot", work.resolve("depot").toString(), "--product", "prod",
                        "--hub");
                daemon(client, work, work.resolve("depot").resolve("prod"));
            }
            case "peer" ->
                peer(client, new Hub(work, peer, "--hub", "--nodes", "a,b,c", "--query-result", "7"), work);
            case "names" -> {
                new Hub(work, peer, "--hub", "--nodes", String.join(",", manyNames()));
                names(client);
            }
            case "unset" -> {
                checkEquals(null, client.getRootDepot(), "getRootDepot without DPX_DEPOTROOT or VESPERHOME");
                checkEquals(null, client.getAgentID(), "getAgentID without AFW_PRODUCT");
                checkEquals(ORIGIN, client.getOriginNode(), "getOriginNode");
            }
            default -> throw new IllegalArgumentException(scenario);
        }
    }

    static byte[] pattern(int size, long seed) {
        byte[] data = new byte[size];
        new Random(seed).nextBytes(data);
        return data;
    }

    static boolean sameBytes(Path file, byte[] expected) throws IOException {
        return Files.exists(file) && Arrays.equals(Files.readAllBytes(file), expected);
    }

    static void daemon(FileTransferClient client, Path work, Path served) throws Exception {
        checkEquals(work.resolve("depot").toString(), client.getRootDepot(), "getRootDepot");
        checkEquals("prod", client.getAgentID(), "getAgentID");
        checkEquals(ORIGIN, client.getOriginNode(), "getOriginNode");
        String text = client.getRPCErrText(0x1C010001);
        check(text != null && !text.isEmpty(), "getRPCErrText has a text for a communication failure");
        checkEquals(null, client.getRPCErrText(0x12345678), "getRPCErrText of a status without text");

        // More than one buffer and an odd tail: several calls each way.
        byte[] remote = pattern(300_001, 1);
        Files.createDirectories(served.resolve("in"));
        Files.write(served.resolve("in/one.bin"), remote);
        Path target = work.resolve("got/one.bin");
        checkEquals(0, client.getFile("n1", "in/one.bin", target.toString()), "getFile status");
        check(sameBytes(target, remote), "getFile moves the bytes");

        byte[] local = pattern(200_000, 2);
        Path source = work.resolve("source.bin");
        Files.write(source, local);
        checkEquals(0, client.putFile("n1", "up/two.bin", source.toString()), "putFile status");
        check(sameBytes(served.resolve("up/two.bin"), local), "putFile moves the bytes");

        checkEquals(INVALID_PARAM, client.getFile(null, "in/one.bin", work.resolve("x").toString()),
                    "getFile with a null node");
        checkEquals(0, client.listNodes(null).length, "listNodes with a null filter");
        checkEquals(0, client.listNodes("").length, "listNodes against the library's own service");

        // Sixteen threads at once, each with its own file up and back down.
        List<String> problems = Collections.synchronizedList(new ArrayList<>());
        List<Thread> threads = IntStream.range(0, 16).mapToObj(n -> new Thread(() -> {
            try {
                byte[] data = pattern(40_000 + n * 7_919, 100 + n);
                Path up = work.resolve("mt-up-" + n), down = work.resolve("mt/down-" + n);
                Files.write(up, data);
                int put = client.putFile("n1", "mt/" + n + ".bin", up.toString());
                int get = client.getFile("n1", "mt/" + n + ".bin", down.toString());
                if (put != 0 || get != 0 || !sameBytes(served.resolve("mt/" + n + ".bin"), data)
                    || !sameBytes(down, data))
                    problems.add("thread " + n + ": put " + put + ", get " + get);
            } catch (IOException e) {
                problems.add(e.toString());
            }
        })).toList();
        threads.forEach(Thread::start);
        for (Thread thread : threads)
            thread.join();
        check(problems.isEmpty(), "16 threads transfer at once: " + problems);
    }

    static void peer(FileTransferClient client, Hub hub, Path work) throws Exception {
        Path source = work.resolve("source.bin");
        Files.write(source, pattern(10, 3));
        checkEquals(INVALID_PARAM, client.getFile(null, "p", work.resolve("t").toString()),
                    "getFile with a null node");
        check(!Files.exists(work.resolve("t")), "getFile with a null node leaves no target");
        checkEquals(INVALID_PARAM, client.putFile(null, "p", source.toString()), "putFile with a null node");

        // The first line of the peer after the null-node calls is the query:
        // those calls never reached it.
        checkEquals(0, client.query(null, "status", "p"), "query with a null node");
        checkEquals("query node=" + ORIGIN, hub.next(), "query with a null node sends the origin node");
        checkEquals("call agent_query 0x00000000", hub.next(), "the peer answers the query");
        checkEquals(0, client.query("zeta", "status", "p"), "query with a node");
        checkEquals("query node=zeta", hub.next(), "query with a node sends that node");

        checkEquals(List.of("a", "b", "c"), Arrays.asList(client.listNodes("")), "listNodes of three names");
        checkEquals(0, client.listNodes(null).length, "listNodes with a null filter");

        int wrong = 0;
        for (int i = 0; i < 10_000; i++)
            if (client.listNodes("").length != 3)
                wrong++;
        checkEquals(0, wrong, "answers other than three names in 10,000 listNodes calls");
    }

    static List<String> manyNames() {
        return IntStream.range(0, 128).mapToObj(i -> i < 127 ? "node" + i : "x".repeat(40)).toList();
    }

    static void names(FileTransferClient client) {
        List<String> expected = new ArrayList<>(manyNames());
        expected.set(127, "x".repeat(32));
        checkEquals(expected, Arrays.asList(client.listNodes("")), "listNodes of 128 names, the longest cut to 32");
    }
}
