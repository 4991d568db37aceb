// Reporting from Rust, over the C interface: the declarations of <kytreporting/kytreporting.h> that it needs, a few safe
// functions around them, to be copied into a program of your own, and a program that sends one event. No callback of the
// library's is used, so nothing of it ever runs on a thread that Rust does not know.
use std::ffi::{CStr, CString, NulError};
use std::fmt;
use std::os::raw::{c_char, c_double, c_int, c_uint};
use std::ptr;
use std::time::Duration;

mod library {
    use super::*;

    #[repr(C)]
    pub struct Dictionary {
        _opaque: [u8; 0],
    }
    #[repr(C)]
    pub struct Session {
        _opaque: [u8; 0],
    }
    /// The first fields of kyt_options: its size tells the library that it has no others.
    #[repr(C)]
    pub struct Options {
        pub size: usize,
        pub socket_path: *const c_char,
        pub session_info: *const Dictionary,
        pub user_info: *const Dictionary,
    }
    pub const ERROR_NONE: c_int = 0;

    #[link(name = "kytreporting")]
    extern "C" {
        pub fn kyt_dictionary_new() -> *mut Dictionary;
        pub fn kyt_dictionary_free(dictionary: *mut Dictionary);
        pub fn kyt_dictionary_set_string(dictionary: *mut Dictionary, key: *const c_char, value: *const c_char);
        pub fn kyt_dictionary_set_int(dictionary: *mut Dictionary, key: *const c_char, value: i64);
        pub fn kyt_dictionary_set_double(dictionary: *mut Dictionary, key: *const c_char, value: c_double);
        pub fn kyt_dictionary_set_bool(dictionary: *mut Dictionary, key: *const c_char, value: c_int);
        pub fn kyt_session_info_check(info: *const Dictionary, error: *mut c_char, size: usize) -> c_int;
        pub fn kyt_session_open(options: *const Options) -> *mut Session;
        pub fn kyt_session_configure(
            session: *mut Session,
            callback: Option<extern "C" fn()>, // none is given here
            context: *mut u8,
        );
        pub fn kyt_session_try_send(
            session: *mut Session,
            category: u32,
            kind: u32,
            payload: *const Dictionary,
            flag: u32,
            error: *mut c_char,
            size: usize,
        ) -> c_int;
        pub fn kyt_session_finish(session: *mut Session, milliseconds: c_uint) -> c_int;
        pub fn kyt_session_close(session: *mut Session);
    }
}

const TEXT_BYTES: usize = 256;

/// What is wrong, in the library's words.
#[derive(Debug)]
pub struct Error(String);

impl fmt::Display for Error {
    fn fmt(&self, out: &mut fmt::Formatter) -> fmt::Result {
        out.write_str(&self.0)
    }
}

impl From<NulError> for Error {
    fn from(_: NulError) -> Self {
        Error("a text with a NUL character cannot be sent".into())
    }
}

/// What a payload may hold.
pub enum Value<'a> {
    Text(&'a str),
    Whole(i64),
    Float(f64),
    Bool(bool),
}

struct Dictionary(*mut library::Dictionary);

impl Dictionary {
    fn of(entries: &[(&str, Value)]) -> Result<Self, Error> {
        let made = Dictionary(unsafe { library::kyt_dictionary_new() });
        for (key, value) in entries {
            made.set(key, value)?;
        }
        Ok(made)
    }

    fn set(&self, key: &str, value: &Value) -> Result<(), Error> {
        let key = CString::new(key)?;
        let key = key.as_ptr();
        match value {
            Value::Text(text) => {
                let text = CString::new(*text)?;
                unsafe { library::kyt_dictionary_set_string(self.0, key, text.as_ptr()) }
            }
            Value::Whole(number) => unsafe { library::kyt_dictionary_set_int(self.0, key, *number) },
            Value::Float(number) => unsafe { library::kyt_dictionary_set_double(self.0, key, *number) },
            Value::Bool(yes) => unsafe { library::kyt_dictionary_set_bool(self.0, key, c_int::from(*yes)) },
        }
        Ok(())
    }
}

impl Drop for Dictionary {
    fn drop(&mut self) {
        unsafe { library::kyt_dictionary_free(self.0) }
    }
}

struct Text([c_char; TEXT_BYTES]);

impl Text {
    fn error(&self) -> Error {
        Error(unsafe { CStr::from_ptr(self.0.as_ptr()) }.to_string_lossy().into_owned())
    }
}

/// One reporting session. It reconnects by itself, and is closed when it is dropped.
pub struct Session(*mut library::Session);

// The library's calls may come from any thread.
unsafe impl Send for Session {}
unsafe impl Sync for Session {}

impl Session {
    /// Makes a session and configures it; never waits for the daemon.
    pub fn open(client_type: i64, client: &str, service: &str) -> Result<Self, Error> {
        let info = Dictionary::of(&[
            ("ClientType", Value::Whole(client_type)),
            ("RequireUserInfo", Value::Bool(true)),
        ])?;
        let user = Dictionary::of(&[("ClientName", Value::Text(client)), ("ServiceName", Value::Text(service))])?;
        let mut why = Text([0; TEXT_BYTES]);
        if unsafe { library::kyt_session_info_check(info.0, why.0.as_mut_ptr(), TEXT_BYTES) } == 0 {
            return Err(why.error());
        }
        let options = library::Options {
            size: std::mem::size_of::<library::Options>(),
            socket_path: ptr::null(),
            session_info: info.0,
            user_info: user.0,
        };
        let session = Session(unsafe { library::kyt_session_open(&options) });
        unsafe { library::kyt_session_configure(session.0, None, ptr::null_mut()) };
        Ok(session)
    }

    /// Queues one message, and does not wait.
    pub fn send(&self, category: u32, kind: u32, payload: &[(&str, Value)]) -> Result<(), Error> {
        let payload = Dictionary::of(payload)?;
        let mut why = Text([0; TEXT_BYTES]);
        let problem = unsafe {
            library::kyt_session_try_send(self.0, category, kind, payload.0, 0, why.0.as_mut_ptr(), TEXT_BYTES)
        };
        if problem == library::ERROR_NONE {
            Ok(())
        } else {
            Err(why.error())
        }
    }

    /// Sends what is queued and waits so long at most; whether the daemon has taken all.
    pub fn finish(&self, timeout: Duration) -> bool {
        unsafe { library::kyt_session_finish(self.0, timeout.as_millis() as c_uint) != 0 }
    }
}

impl Drop for Session {
    fn drop(&mut self) {
        unsafe { library::kyt_session_close(self.0) }
    }
}

fn report() -> Result<(), Error> {
    let session = Session::open(20, "hello", "demo")?;
    session.send(10, 1, &[("step", Value::Whole(1)), ("duration", Value::Float(0.25))])?;
    if session.finish(Duration::from_secs(5)) {
        Ok(())
    } else {
        Err(Error("the daemon has not taken all".into()))
    }
}

fn main() {
    if let Err(error) = report() {
        eprintln!("report: {}", error);
        std::process::exit(1);
    }
}
