! SORTFILE from Fortran on more records than the memory target holds
! (1.5 million records of 10 values, 120 MB), so the sort writes runs to
! temporary files and merges them. Records are made on the fly and checked
! as they come out: key descending, equal keys in input order, every value
! still with its record, every record exactly once.
module large_state
  use isort_api
  implicit none
  integer(c_int32_t), parameter :: nrec = 1500000, width = 10
  integer(c_int32_t) :: nread = 0, nwritten = 0, errors = 0
  integer(c_int32_t) :: lastkey = huge(1_c_int32_t)
  integer(c_int32_t) :: lastid = 0
  logical, allocatable :: seen(:)

contains

  ! Keys and values are whole numbers, so they are compared as integers.
  pure integer(c_int32_t) function key_of(i)
    integer(c_int32_t), intent(in) :: i
    key_of = int(mod(int(i, c_int64_t) * 7919_c_int64_t, 5003_c_int64_t), c_int32_t)
  end function

  pure integer(c_int64_t) function value_of(i, j)
    integer(c_int32_t), intent(in) :: i
    integer, intent(in) :: j
    value_of = int(i, c_int64_t) * 16_c_int64_t + j
  end function

  integer(c_int32_t) function give(context, buffer, nvars) bind(c)
    integer(c_int32_t), intent(inout) :: context
    integer(c_int32_t), intent(in) :: nvars
    real(c_double), intent(out) :: buffer(nvars)
    integer :: j
    if (nread >= nrec) then
      give = 1
      return
    end if
    nread = nread + 1
    context = context + 1
    buffer(1) = real(key_of(nread), c_double)
    buffer(2) = real(nread, c_double)
    do j = 3, nvars
      buffer(j) = real(value_of(nread, j), c_double)
    end do
    give = 0
  end function

  integer(c_int32_t) function take(context, record, nvars) bind(c)
    integer(c_int32_t), intent(inout) :: context
    integer(c_int32_t), intent(in) :: nvars
    real(c_double), intent(in) :: record(nvars)
    integer(c_int32_t) :: id, key
    integer :: j
    take = 0
    context = context - 1
    nwritten = nwritten + 1
    id = int(record(2), c_int32_t)
    if (id < 1 .or. id > nrec) then
      errors = errors + 1
      return
    end if
    if (seen(id)) errors = errors + 1
    seen(id) = .true.
    key = int(record(1), c_int32_t)
    if (key /= key_of(id)) errors = errors + 1
    do j = 3, nvars
      if (int(record(j), c_int64_t) /= value_of(id, j)) errors = errors + 1
    end do
    if (key > lastkey) errors = errors + 1
    if (key == lastkey .and. id <= lastid) errors = errors + 1
    lastkey = key
    lastid = id
  end function
end module

program sort_large
  use large_state
  implicit none
  integer(c_int32_t) :: context, code, nukeys, nvars
  integer(c_int32_t) :: ukeys(3)

  allocate (seen(nrec))
  seen = .false.
  ukeys = [1, -1, 0]
  nukeys = 1
  nvars = width
  context = 0
  code = sort_checked(context, c_funloc(give), c_funloc(take), nvars, ukeys, nukeys, 'spilled sort')
  call check(code == 0, 'sort returns 0')
  call check(nread == nrec .and. nwritten == nrec, 'every record in and out')
  call check(context == 0, 'the context is the caller''s variable')
  call check(errors == 0, 'order, stability and contents')
  call check(all(seen), 'every record once')
  print '(a)', 'sort_large: all checks passed'
end program
