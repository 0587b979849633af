package android.hardware.secure_element;

@VintfStability
interface ISecureElementCallback {
    // The element became usable (true) or unusable (false).
    void onStateChange(in boolean connected, in String debugReason);
}
