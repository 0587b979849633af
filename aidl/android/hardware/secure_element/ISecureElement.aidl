package android.hardware.secure_element;

import android.hardware.secure_element.ISecureElementCallback;
import android.hardware.secure_element.LogicalChannelResponse;

@VintfStability
interface ISecureElement {
    // Service-specific errors of the calls below.
    const int FAILED = 1;
    const int CHANNEL_NOT_AVAILABLE = 2;
    const int NO_SUCH_ELEMENT_ERROR = 3;
    const int UNSUPPORTED_OPERATION = 4;
    const int IOERROR = 5;

    // Closes a basic (0) or logical channel; FAILED when it is not open.
    void closeChannel(in byte channelNumber);

    // The element's ATR; empty when it has none to give.
    byte[] getAtr();

    // Starts the element; readiness goes to clientCallback.onStateChange.
    void init(in ISecureElementCallback clientCallback);

    boolean isCardPresent();

    // Selects the applet `aid` on the basic channel; its SELECT response.
    byte[] openBasicChannel(in byte[] aid, in byte p2);

    // Opens a logical channel and selects the applet `aid` on it.
    LogicalChannelResponse openLogicalChannel(in byte[] aid, in byte p2);

    // Closes every channel, reports onStateChange(false), restarts the
    // element and reports onStateChange(true) once it is ready.
    void reset();

    // Sends a command APDU on the channel its CLA names; the response APDU.
    byte[] transmit(in byte[] data);
}
