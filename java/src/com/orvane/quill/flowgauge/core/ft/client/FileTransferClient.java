package com.orvane.quill.flowgauge.core.ft.client;

/**
 * Java face of the libdpx client: fetches and stores whole files on the hub.
 * Every method blocks the calling thread for the whole operation. Statuses
 * are the library's 32-bit codes as ints: 0 is success, the library's own
 * failures are negative; getRPCErrText gives a text for a status.
 */
public class FileTransferClient {
    static {
        System.loadLibrary("dpx");
    }

    /** Fetches path of node from the depot into the local file target. */
    public native int getFile(String node, String path, String target);

    /** Appends the local file source to path of node in the depot. */
    public native int putFile(String node, String path, String source);

    /** Sends query with path to node; a null node is this process's node. */
    public native int query(String node, String query, String path);

    /** Node names that the hub lists for filter; empty on any failure. */
    public native String[] listNodes(String filter);

    /** The depot root of this process, or null when none is known. */
    public native String getRootDepot();

    /** The product name of this agent, or null when none is known. */
    public native String getAgentID();

    /** The node name of this process. */
    public native String getOriginNode();

    /** A text for status, or null for a status without one. */
    public native String getRPCErrText(int status);
}
