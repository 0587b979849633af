package android.hardware.secure_element;

@VintfStability
parcelable LogicalChannelResponse {
    // The SELECT response, status word included.
    byte[] selectResponse;
    // 1 to 19.
    byte channelNumber;
}
