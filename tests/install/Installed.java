// A Java program against the installed jar and library: a put, then a get.
// usage: java Installed SOURCE TARGET
import com.orvane.quill.flowgauge.core.ft.client.FileTransferClient;

public class Installed {
    public static void main(String[] args) {
        FileTransferClient client = new FileTransferClient();
        int put = client.putFile("node1", "installed/java.bin", args[0]);
        int get = client.getFile("node1", "installed/java.bin", args[1]);
        System.out.println("put " + put + " get " + get);
        System.exit(put == 0 && get == 0 ? 0 : 1);
    }
}
