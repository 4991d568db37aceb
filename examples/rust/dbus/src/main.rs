// Reporting from Rust without the library, over D-Bus (the crate dbus, Debian's librust-dbus-dev). The connection is the
// session; it goes to the daemon itself and not to a bus, so it is opened as a private one and nothing is registered.
// Reconnecting, queueing and counting are the program's own business here: the library does them for report.rs.
use dbus::arg::{PropMap, Variant};
use dbus::channel::Channel;
use dbus::Message;
use std::time::Duration;

const PATIENCE: Duration = Duration::from_secs(10);

fn call(method: &str) -> Message {
    Message::call_with_args(
        "com.vantu.kytreportingd", // any name will do: nobody else is there
        "/com/vantu/kytreportingd",
        "com.vantu.kytreportingd.ClientSessionInterface",
        method,
        (),
    )
}

fn report() -> Result<(), Box<dyn std::error::Error>> {
    let socket = std::env::var("KYTREPORTING_SOCKET")
        .unwrap_or_else(|_| "/run/kytreportingd/com.vantu.kytreportingd".to_string());
    let daemon = Channel::open_private(&format!("unix:path={}", socket))?;
    let ask = |message: Message| daemon.send_with_reply_and_block(message, PATIENCE);

    let mut information = PropMap::new();
    information.insert("SessionID".into(), Variant(Box::new(45u32)));
    information.insert("ClientType".into(), Variant(Box::new(20i32)));
    information.insert("RequireUserInfo".into(), Variant(Box::new(true)));
    let mut user = PropMap::new();
    user.insert("ClientName".into(), Variant(Box::new("hello".to_string())));
    user.insert("ServiceName".into(), Variant(Box::new("demo".to_string())));
    // What may be none is an array of nothing or one: the user's information, and no frameworks to check.
    let none: Vec<Variant<String>> = Vec::new();
    ask(call("SetSessionInfo").append3(information, vec![user], none).append1(false))?;
    let live: Vec<Vec<String>> = ask(call("StartConfigWithCompletionHandler"))?.read1()?;
    println!("live back ends: {:?}", live);

    let mut payload = PropMap::new();
    payload.insert("step".into(), Variant(Box::new(1i32)));
    let mut message = PropMap::new();
    message.insert("Category".into(), Variant(Box::new(10i32)));
    message.insert("Type".into(), Variant(Box::new(1i32)));
    message.insert("Payload".into(), Variant(Box::new(payload)));
    ask(call("SendMessageWithDictionary").append1(message))?;
    ask(call("FinishSessionGracefully"))?;
    Ok(())
}

fn main() {
    if let Err(error) = report() {
        eprintln!("report: {}", error);
        std::process::exit(1);
    }
}
